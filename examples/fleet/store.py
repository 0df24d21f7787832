"""ClickHouse from Debian's packages: unpacked below a directory, never installed, listening on loopback alone."""
import glob
import os
import signal
import socket
import subprocess
import time
import urllib.error
import urllib.parse
import urllib.request

PACKAGES = ("clickhouse-server", "libfaketime")
CONFIG = """<yandex>
  <logger><level>warning</level><console>1</console></logger>
  <http_port>{port}</http_port>
  <listen_host>127.0.0.1</listen_host>
  <path>{root}/data/</path>
  <tmp_path>{root}/tmp/</tmp_path>
  <users_config>users.xml</users_config>
  <mark_cache_size>67108864</mark_cache_size>
  <timezone>UTC</timezone>
</yandex>
"""
USERS = """<yandex>
  <profiles><default><max_memory_usage>1000000000</max_memory_usage></default></profiles>
  <users><default><password></password><networks><ip>127.0.0.1</ip></networks><profile>default</profile>
    <quota>default</quota></default></users>
  <quotas><default></default></quotas>
</yandex>
"""


def unpack(directory):
    """Downloads the packages and what they depend on, and unpacks them below `directory`."""
    cache = os.path.join(directory, "packages")
    os.makedirs(os.path.join(cache, "partial"))
    command = ["apt-get", "install", "-qq", "--no-install-recommends", "--download-only", "-o", "APT::Sandbox::User=root", "-o", f"Dir::Cache::archives={cache}"]
    subprocess.run([*command, *PACKAGES], check=True, stdout=subprocess.DEVNULL)
    # What is installed already is not downloaded again by the command above.
    for package in PACKAGES:
        if not glob.glob(os.path.join(cache, package + "_*.deb")):
            subprocess.run(["apt-get", "download", "-qq", "-o", "APT::Sandbox::User=root", package], check=True, cwd=cache, stderr=subprocess.DEVNULL)
    for package in glob.glob(os.path.join(cache, "*.deb")):
        subprocess.run(["dpkg", "-x", package, os.path.join(directory, "unpacked")], check=True)
        os.remove(package)
    return os.path.join(directory, "unpacked")


class Store:
    """A server with its data below `directory`. It can be killed and started again."""

    def __init__(self, directory, unpacked):
        self.root, self.process = os.path.join(directory, "store"), None
        os.makedirs(self.root)
        with socket.socket() as probe:
            probe.bind(("127.0.0.1", 0))
            self.port = probe.getsockname()[1]
        for name, text in (("config.xml", CONFIG), ("users.xml", USERS)):
            with open(os.path.join(self.root, name), "w", encoding="utf-8") as file:
                file.write(text.format(port=self.port, root=self.root))
        # Debian's packages use four folders for libraries, two of them named after the machine's architecture. The loader
        # knows none of these.
        libraries = [path for top in ("usr/lib", "lib")
                     for path in (*glob.glob(os.path.join(unpacked, top, "*-linux-gnu*")), os.path.join(unpacked, top))]
        self.environment = {**os.environ, "LD_LIBRARY_PATH": ":".join(libraries)}
        self.program = os.path.join(unpacked, "usr/sbin/clickhouse-server")
        self.url = f"http://127.0.0.1:{self.port}/"

    def start(self):
        with open(os.path.join(self.root, "log"), "ab") as log:
            self.process = subprocess.Popen([self.program, "--config-file=config.xml"], cwd=self.root, env=self.environment,
                                            stdout=log, stderr=log, stdin=subprocess.DEVNULL)
        for _ in range(600):
            try:
                return self.query("SELECT 1")
            except OSError:
                if self.process.poll() is not None:
                    break
                time.sleep(0.1)
        with open(os.path.join(self.root, "log"), encoding="utf-8", errors="replace") as log:
            raise RuntimeError("the store does not start: " + log.read()[-1000:])

    def kill(self):
        self.process.send_signal(signal.SIGKILL)
        self.process.wait()

    def insert_url(self, table="events"):
        """Where a forwarder posts its lines. Members that the table has no column for are skipped."""
        query = {"query": f"INSERT INTO {table} FORMAT JSONEachRow", "input_format_skip_unknown_fields": "1"}
        return self.url + "?" + urllib.parse.urlencode(query, quote_via=urllib.parse.quote)

    def query(self, sql):
        """The rows of the answer, each a list of texts."""
        try:
            with urllib.request.urlopen(self.url, data=sql.encode(), timeout=300) as answer:
                return [line.split("\t") for line in answer.read().decode().splitlines()]
        except urllib.error.HTTPError as error:
            raise RuntimeError(error.read().decode()[:500]) from error
