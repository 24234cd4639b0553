#!/usr/bin/env python3
"""Drives the update page in headless Chromium through ChromeDriver's WebDriver HTTP API
(standard library only) and fails on a script error or a wrong state.  One screenshot per
step in OUT.  PUBLISH... is a command that publishes on the site what one more argument
names: "reboot-fix" (fix 3, which needs a reboot) or "release" (release 5.2-5700).
    page_browser.py BASE_URL OUT_DIR PUBLISH..."""
import base64, json, os, subprocess, sys, time, urllib.request

BASE, OUT, PUBLISH = sys.argv[1], sys.argv[2], sys.argv[3:]
WD = "http://127.0.0.1:9515"


def call(method, path, body=None):
    data = json.dumps(body).encode() if body is not None else None
    req = urllib.request.Request(WD + path, data=data, method=method,
                                 headers={"Content-Type": "application/json"})
    with urllib.request.urlopen(req, timeout=60) as r:
        return json.loads(r.read())["value"]


class Page:
    def __init__(self):
        caps = {"capabilities": {"alwaysMatch": {
            "goog:loggingPrefs": {"browser": "ALL"},
            "goog:chromeOptions": {"binary": "/usr/bin/chromium", "args": [
                "--headless", "--no-sandbox", "--disable-gpu", "--disable-quic",
                "--no-first-run", "--disable-background-networking",
                "--disable-component-update", "--disable-sync", "--disable-dev-shm-usage",
                "--window-size=700,720", "--user-data-dir=/tmp/kyto-page-chromium"]}}}}
        self.sid = call("POST", "/session", caps)["sessionId"]
        self.step = 0

    def s(self, path):
        return "/session/%s%s" % (self.sid, path)

    def js(self, script):
        return call("POST", self.s("/execute/sync"), {"script": script, "args": []})

    def text(self, id_):
        return self.js("return document.getElementById(%r).textContent" % id_)

    def enabled(self, id_):
        return not self.js("return document.getElementById(%r).disabled" % id_)

    def click(self, id_):
        el = call("POST", self.s("/element"), {"using": "css selector", "value": "#" + id_})
        call("POST", self.s("/element/%s/click" % list(el.values())[0]), {})

    def shot(self, name):
        time.sleep(0.5)  # the bar's transition
        self.step += 1
        png = base64.b64decode(call("GET", self.s("/screenshot")))
        with open(os.path.join(OUT, "%02d-%s.png" % (self.step, name)), "wb") as f:
            f.write(png)

    def errors(self):
        logs = call("POST", self.s("/se/log"), {"type": "browser"})
        return [l["message"] for l in logs if l["level"] == "SEVERE"]

    def wait(self, what, cond, seconds=30):
        end = time.time() + seconds
        while time.time() < end:
            if cond():
                return
            time.sleep(0.2)
        self.shot("failed")
        raise AssertionError("timed out waiting for " + what + "; message: " + self.text("message"))


def run(p):
    call("POST", p.s("/url"), {"url": BASE + "/"})
    p.wait("the installed version", lambda: p.text("installed") == "5.2-5644")
    assert p.text("smallfix") == "0", p.text("smallfix")
    assert not p.enabled("download") and not p.enabled("apply") and not p.enabled("cancel")
    p.shot("loaded")
    p.click("check")
    p.wait("the offer", lambda: p.text("offer") == "Small update: VYX 5.2-5644 update 2")
    p.wait("download enabled", lambda: p.enabled("download"))
    p.shot("checked")
    p.click("download")
    p.wait("the bar moving", lambda: p.text("download-state") == "downloading"
           and 0 < int(p.text("percent").rstrip("%")) < 100)
    assert p.enabled("cancel") and not p.enabled("download") and not p.enabled("apply")
    assert "package" in p.text("items"), p.text("items")
    p.shot("downloading")
    # A second page that has not seen the download yet posts another: the library refuses.
    p.js("document.getElementById('download').disabled = false")
    p.click("download")
    p.wait("the refusal", lambda: "a download is already running" in p.text("message"))
    assert "error" in p.js("return document.getElementById('message').className")
    p.shot("refused")
    p.click("cancel")
    # The package being fetched ends first: the page says so and offers no new download.
    p.wait("the download stopping", lambda: p.text("download-state") in ("stopping", "cancelled"))
    if p.text("download-state") == "stopping":
        assert not p.enabled("download") and not p.enabled("check")
        p.shot("stopping")
    p.wait("the download stopped", lambda: p.text("download-state") == "cancelled", 60)
    p.wait("download enabled again", lambda: p.enabled("download"))
    assert "error" not in p.js("return document.getElementById('message').className")
    p.shot("cancelled")
    p.click("download")
    p.wait("downloaded", lambda: p.text("download-state") in ("downloaded", "failed"), 90)
    assert p.text("download-state") == "downloaded", p.text("message")
    p.wait("apply enabled", lambda: p.enabled("apply"))
    assert p.text("percent") == "100%", p.text("percent")
    p.wait("the download's end", lambda: p.text("message").startswith("download: downloaded "))
    p.shot("downloaded")
    p.click("apply")
    p.wait("small fix 2", lambda: p.text("smallfix") == "2", 90)
    p.wait("apply finished", lambda: "finish" in p.text("apply-state"), 30)
    assert not p.enabled("apply") and not p.enabled("download")
    assert p.text("offer") == "Not checked since the last apply.", p.text("offer")
    p.shot("applied")


def publish(what):
    subprocess.run(PUBLISH + [what], check=True, stdout=subprocess.DEVNULL)


def reboot_fix(p):
    """The vendor publishes a fix that needs a reboot: once applied, the page asks for the
    restart, and the new small-fix level is already recorded."""
    publish("reboot-fix")
    p.click("check")
    p.wait("fix 3 offered", lambda: p.text("offer") == "Small update: VYX 5.2-5644 update 3")
    p.wait("download enabled", lambda: p.enabled("download"))
    p.click("download")
    p.wait("downloaded", lambda: p.text("download-state") in ("downloaded", "failed"), 90)
    assert p.text("download-state") == "downloaded", p.text("message")
    p.wait("apply enabled", lambda: p.enabled("apply"))
    p.click("apply")
    p.wait("the restart asked for", lambda: "restart the appliance" in p.text("apply-state"), 60)
    assert "reboot" in p.js("return document.getElementById('apply-state').className")
    assert p.text("smallfix") == "3" and not p.enabled("apply"), p.text("smallfix")
    p.shot("reboot-needed")


def release(p):
    """The vendor publishes a full release: offered, downloaded image by image, left to the
    installer."""
    publish("release")
    p.click("check")
    p.wait("the release offered", lambda: p.text("offer") == "Full release: VYX 5.2-5700")
    p.wait("download enabled", lambda: p.enabled("download"))
    p.click("download")
    p.wait("the image moving", lambda: p.text("download-state") == "downloading"
           and p.text("items") == "(image 1 of 1)" and p.text("percent") not in ("0%", "100%"))
    p.shot("release-downloading")
    p.wait("downloaded", lambda: p.text("download-state") in ("downloaded", "failed"), 90)
    assert p.text("download-state") == "downloaded", p.text("message")
    assert not p.enabled("apply") and "installer" in p.text("apply-state"), p.text("apply-state")
    p.shot("release-downloaded")


def main():
    driver = subprocess.Popen(["chromedriver", "--port=9515"], stdout=subprocess.DEVNULL,
                              stderr=subprocess.DEVNULL)
    try:
        for _ in range(100):
            try:
                call("GET", "/status")
                break
            except OSError:
                time.sleep(0.1)
        p = Page()
        try:
            run(p)
            reboot_fix(p)
            release(p)
            errors = p.errors()
            assert not errors, "script errors: %s" % errors
        finally:
            print("browser errors:", p.errors())
            call("DELETE", p.s(""))
    finally:
        driver.terminate()
        driver.wait()
    print("page_browser.py: all steps passed (%d screenshots in %s)" % (p.step, OUT))


if __name__ == "__main__":
    main()
