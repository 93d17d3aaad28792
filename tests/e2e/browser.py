"""A headless Chromium, spoken to over its debugging pipe: what a page does there, and how it looks."""
import base64
import json
import os
import select
import shutil
import subprocess
import tempfile
import time


class Browser:
    def __init__(self, patience=60):
        self.patience = patience
        self.profile = tempfile.mkdtemp(prefix="vxbrowser")
        to_read, self.to_write = os.pipe()
        self.from_read, from_write = os.pipe()

        def pipes():  # which it looks for at 3 and 4
            os.dup2(to_read, 63)
            os.dup2(from_write, 64)
            os.dup2(63, 3)
            os.dup2(64, 4)

        self.process = subprocess.Popen(
            ["chromium", "--headless", "--no-sandbox", "--disable-gpu", "--disable-dev-shm-usage", "--hide-scrollbars",
             "--disable-background-networking", f"--user-data-dir={self.profile}", "--remote-debugging-pipe", "about:blank"],
            preexec_fn=pipes, close_fds=False, stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
        os.close(to_read)
        os.close(from_write)
        self.buffer, self.number, self.events = b"", 0, []
        target = self.call("Target.createTarget", url="about:blank")["targetId"]
        self.session = self.call("Target.attachToTarget", targetId=target, flatten=True)["sessionId"]
        for domain in ("Page", "Runtime", "Log", "Network"):
            self.call(domain + ".enable")

    def receive(self):
        end = time.monotonic() + self.patience
        while b"\0" not in self.buffer:
            if not select.select([self.from_read], [], [], max(0, end - time.monotonic()))[0]:
                raise TimeoutError("the browser says nothing")
            data = os.read(self.from_read, 1 << 20)
            if not data:
                raise ConnectionError("the browser has ended")
            self.buffer += data
        message, _, self.buffer = self.buffer.partition(b"\0")
        return json.loads(message)

    def call(self, method, **parameters):
        self.number += 1
        message = {"id": self.number, "method": method, "params": parameters}
        if hasattr(self, "session"):
            message["sessionId"] = self.session
        data = json.dumps(message).encode() + b"\0"
        while data:
            data = data[os.write(self.to_write, data):]
        while True:
            answer = self.receive()
            if answer.get("id") == self.number:
                assert "error" not in answer, (method, answer)
                return answer["result"]
            self.events.append(answer)

    def open(self, path, width=1200, height=900, dark=False):
        """Opens a file, and forgets what the last one did."""
        self.events = []
        self.call("Emulation.setDeviceMetricsOverride", width=width, height=height, deviceScaleFactor=1, mobile=width < 600)
        self.call("Emulation.setEmulatedMedia",
                  features=[{"name": "prefers-color-scheme", "value": "dark" if dark else "light"}])
        self.call("Page.navigate", url="file://" + os.path.abspath(path))
        end = time.monotonic() + self.patience
        while self.evaluate("document.readyState") != "complete":
            assert time.monotonic() < end, "the page does not load"
            time.sleep(0.02)

    def evaluate(self, expression):
        result = self.call("Runtime.evaluate", expression=expression, returnByValue=True, awaitPromise=True)
        assert "exceptionDetails" not in result, result
        return result["result"].get("value")

    def said(self):
        """Everything that the page has complained of."""
        return [e["params"] for e in self.events
                if e["method"] in ("Runtime.exceptionThrown", "Runtime.consoleAPICalled", "Log.entryAdded")]

    def asked_for(self):
        """The addresses that it has asked for, but for files and what lies in the page itself."""
        return [e["params"]["request"]["url"] for e in self.events if e["method"] == "Network.requestWillBeSent"
                and not e["params"]["request"]["url"].startswith(("file:", "data:"))]

    def picture(self, path=None, whole=True):
        data = base64.b64decode(self.call("Page.captureScreenshot", format="png", captureBeyondViewport=whole)["data"])
        if path:
            with open(path, "wb") as f:
                f.write(data)
        return data

    def close(self):
        self.process.kill()
        self.process.wait()
        os.close(self.to_write)
        os.close(self.from_read)
        shutil.rmtree(self.profile, ignore_errors=True)
