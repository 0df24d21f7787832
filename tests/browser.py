"""A headless Chromium, driven over a pipe in the DevTools protocol."""
import base64
import json
import os
import shutil
import subprocess
import tempfile

WITHOUT_HOME = ("HOME", "XDG_CONFIG_HOME", "XDG_CACHE_HOME", "TMPDIR")


class Browser:
    """One browser with a directory of its own, so nothing of it stays."""

    def __init__(self):
        self.root = tempfile.mkdtemp(prefix="tessel-test-browser-")
        commands, self.commands = os.pipe()
        self.answers, answers = os.pipe()
        # The browser takes its commands from descriptor 3 and answers on 4.
        moved = [os.dup(end) for end in (commands, answers, 0, 0)]

        def connect():
            os.dup2(moved[0], 3)
            os.dup2(moved[1], 4)

        self.errors = tempfile.TemporaryFile()
        self.process = subprocess.Popen(
            ["chromium", "--headless=new", "--no-sandbox", "--disable-gpu", "--disable-dev-shm-usage", "--no-first-run",
             "--disable-background-networking", "--disable-component-update", "--hide-scrollbars",
             "--remote-debugging-pipe", f"--user-data-dir={self.root}/profile", "about:blank"],
            env={**os.environ, **{name: self.root for name in WITHOUT_HOME}}, preexec_fn=connect, pass_fds=(3, 4),
            stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL, stderr=self.errors)
        for end in (commands, answers, *moved):
            os.close(end)
        self.rest, self.number, self.events = b"", 0, []

    def close(self):
        self.call("Browser.close")
        self.process.wait(30)
        os.close(self.commands)
        os.close(self.answers)
        self.errors.close()
        shutil.rmtree(self.root, ignore_errors=True)

    def call(self, method, session=None, **arguments):
        """What the browser answers; what it tells meanwhile goes to `events`."""
        self.number += 1
        message = {"id": self.number, "method": method, "params": arguments}
        message.update({"sessionId": session} if session else {})
        text = json.dumps(message).encode() + b"\0"
        while text:
            text = text[os.write(self.commands, text):]
        while True:
            message = self._message()
            if message.get("id") == self.number:
                if "error" in message:
                    raise RuntimeError(f"{method}: {message['error']}")
                return message["result"]
            self.events.append(message)

    def _message(self):
        while b"\0" not in self.rest:
            data = os.read(self.answers, 1 << 16)
            if not data:
                self.errors.seek(0)
                raise RuntimeError("the browser ended: " + self.errors.read().decode()[-2000:])
            self.rest += data
        text, self.rest = self.rest.split(b"\0", 1)
        return json.loads(text)


class Page:
    """A file in a tab of its own."""

    KEYS = {"Tab": 9, "Enter": 13, " ": 32}

    def __init__(self, browser, path, width=1400, dark=False, script=True):
        self.browser = browser
        self.target = browser.call("Target.createTarget", url="about:blank")["targetId"]
        self.session = browser.call("Target.attachToTarget", targetId=self.target, flatten=True)["sessionId"]
        for domain in ("Page", "Runtime", "Log", "Network"):
            self.call(domain + ".enable")
        self.set_width(width)
        self.call("Emulation.setEmulatedMedia", features=[{"name": "prefers-color-scheme", "value": "dark" if dark else "light"}])
        self.call("Emulation.setScriptExecutionDisabled", value=not script)
        self.browser.events.clear()
        self.call("Page.navigate", url="file://" + path)
        while not any(event["method"] == "Page.loadEventFired" for event in self.browser.events):
            self.browser.events.append(self.browser._message())

    def call(self, method, **arguments):
        return self.browser.call(method, self.session, **arguments)

    def set_width(self, width):
        self.call("Emulation.setDeviceMetricsOverride", width=width, height=900, deviceScaleFactor=1, mobile=False)

    def run(self, script):
        """The value of a JavaScript expression; the tools may run it also where the page may run none."""
        answer = self.call("Runtime.evaluate", expression=script, returnByValue=True)
        if "exceptionDetails" in answer:
            raise RuntimeError(json.dumps(answer["exceptionDetails"]))
        return answer["result"].get("value")

    def press(self, key):
        keys = {"key": key, "windowsVirtualKeyCode": self.KEYS[key]}
        text = {"Enter": "\r", " ": " "}.get(key)
        self.call("Input.dispatchKeyEvent", type="keyDown", **keys, **({"text": text} if text else {}))
        self.call("Input.dispatchKeyEvent", type="keyUp", **keys)

    def type(self, text):
        self.call("Input.insertText", text=text)

    def events(self, *methods):
        return [event["params"] for event in self.browser.events
                if event.get("sessionId") == self.session and event["method"] in methods]

    def screenshot(self, path):
        picture = self.call("Page.captureScreenshot", captureBeyondViewport=True)
        with open(path, "wb") as file:
            file.write(base64.b64decode(picture["data"]))

    def close(self):
        self.browser.call("Target.closeTarget", targetId=self.target)
