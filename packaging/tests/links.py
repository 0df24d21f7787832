"""links.py DIRECTORY: names each relative link of the pages below DIRECTORY that leads nowhere."""
import pathlib
import re
import sys

links = [(page, target) for page in pathlib.Path(sys.argv[1]).rglob("*.md")
         for target in re.findall(r"\]\(([^)#\s]+)[^)]*\)", page.read_text(encoding="utf-8")) if "://" not in target]
broken = [(page, target) for page, target in links if not (page.parent / target).exists()]
for page, target in broken:
    print(f"{page}: {target}")
sys.exit(1 if broken or not links else 0)
