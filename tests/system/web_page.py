#!/usr/bin/env python3
"""Uses the page of "fileindex web" in a headless Chromium, as a person would.

usage: web_page.py URL FOLDER
  URL     what "fileindex web" printed
  FOLDER  the indexed folder: 45 texts with "harbour", two with "lighthouse", one of them below a
          folder whose name is no UTF-8 and one with markup in its name and text

Says what is not as it should be, and ends with 1 then.
"""

import json
import os
import shutil
import subprocess
import sys
import tempfile
import time

PATIENCE = 30  # Seconds, for a busy machine.


class Browser:
    """One page, driven through a pair of pipes with a JSON text and a NUL for each message."""

    def __init__(self):
        self.home = tempfile.mkdtemp()
        commands, self.commands = os.pipe()
        self.replies, replies = os.pipe()
        self.process = subprocess.Popen(
            ["sh", "-c", f'exec 3<&{commands} 4>&{replies}; exec "$@"', "sh",
             "chromium", "--headless", "--no-sandbox", "--disable-gpu", "--disable-dev-shm-usage",
             "--no-first-run", "--disable-background-networking", "--lang=en-US",
             f"--user-data-dir={self.home}", "--remote-debugging-pipe", "about:blank"],
            pass_fds=(commands, replies), stdin=subprocess.DEVNULL, stdout=subprocess.DEVNULL,
            stderr=subprocess.DEVNULL)
        os.close(commands)
        os.close(replies)
        self.buffer = b""
        self.count = 0
        self.events = []
        self.session = None
        target = self.call("Target.createTarget", url="about:blank")["targetId"]
        self.session = self.call("Target.attachToTarget", targetId=target, flatten=True)["sessionId"]
        for domain in ("Page", "Runtime", "Log", "Network"):
            self.call(domain + ".enable")

    def close(self):
        self.process.terminate()
        self.process.wait()
        shutil.rmtree(self.home, ignore_errors=True)

    def call(self, method, **params):
        self.count += 1
        message = {"id": self.count, "method": method, "params": params}
        if self.session:
            message["sessionId"] = self.session
        os.write(self.commands, json.dumps(message).encode() + b"\0")
        while True:
            while b"\0" not in self.buffer:
                part = os.read(self.replies, 1 << 16)
                if not part:
                    sys.exit("the browser has ended")
                self.buffer += part
            text, self.buffer = self.buffer.split(b"\0", 1)
            reply = json.loads(text)
            if reply.get("id") == self.count:
                if "error" in reply:
                    sys.exit(f"{method}: {reply['error']}")
                return reply["result"]
            self.events.append(reply)

    def js(self, expression):
        result = self.call("Runtime.evaluate", expression=expression, awaitPromise=True,
                           returnByValue=True)
        if "exceptionDetails" in result:
            sys.exit(f"{expression}: {result['exceptionDetails']}")
        return result["result"].get("value")

    def keys(self, *names):
        for name in names:
            text = {"Enter": "\r"}.get(name, name if len(name) == 1 else "")
            code = {"Enter": 13, "Tab": 9, "ArrowDown": 40, "ArrowUp": 38}.get(name, 0)
            self.call("Input.dispatchKeyEvent", type="keyDown", key=name, text=text,
                      windowsVirtualKeyCode=code)
            self.call("Input.dispatchKeyEvent", type="keyUp", key=name, windowsVirtualKeyCode=code)

    def shape(self, width, height):
        self.call("Emulation.setDeviceMetricsOverride", width=width, height=height,
                  deviceScaleFactor=1, mobile=width < 500)


failures = []


def check(what, got, wanted):
    if got != wanted:
        failures.append(f"{what}: {got!r}, and not {wanted!r}")


def await_text(browser, expression, wanted):
    """Until the expression's text begins so."""
    end = time.monotonic() + PATIENCE
    while not (browser.js(expression) or "").startswith(wanted):
        if time.monotonic() > end:
            sys.exit(f"{expression} is {browser.js(expression)!r}, and does not become {wanted!r}")
        time.sleep(0.05)


SUMMARY = "document.getElementById('summary')?.textContent"
NAMES = "[...document.querySelectorAll('#results h3')].map((name) => name.textContent)"
FOCUS = "document.activeElement?.id"
PROBLEM = "document.getElementById('problem')?.textContent"
STATE = "document.getElementById('state')?.textContent"


def look_for(browser, words):
    """By the keyboard alone, from wherever the focus is."""
    browser.js("document.activeElement.blur()")
    browser.keys("/")
    browser.call("Input.insertText", text=words)
    browser.keys("Enter")


def check_width(browser, what):
    browser.shape(360, 640)
    check(f"the width of {what} on a phone", browser.js("document.documentElement.scrollWidth"), 360)
    browser.shape(1000, 640)


def use_search(browser, folder):
    await_text(browser, STATE, "Everything can be found.")
    await_text(browser, SUMMARY, "Type what")
    look_for(browser, "harbour")
    await_text(browser, SUMMARY, "45 files found, 1 to 20 shown.")
    check("what is marked", browser.js("document.querySelector('#results mark').textContent"), "harbour")
    check_width(browser, "the results")
    browser.keys("ArrowDown", "ArrowDown")
    check("the focus is on the second hit", browser.js("document.activeElement.previousElementSibling"
                                                       " === document.getElementById('results').firstElementChild"), True)
    browser.keys("ArrowUp", "ArrowUp")
    check("the focus above the first hit", browser.js(FOCUS), "words")
    browser.js("document.getElementById('next').focus()")
    browser.keys("Enter")
    await_text(browser, SUMMARY, "45 files found, 21 to 40 shown.")
    browser.js("history.back()")
    await_text(browser, SUMMARY, "45 files found, 1 to 20 shown.")

    look_for(browser, "lighthouse")
    await_text(browser, SUMMARY, "2 files found.")
    check("the names", sorted(browser.js(NAMES)), ["<img src=x onerror=alert(1)>.txt", "na\\357ve.txt"])
    check("elements that came from files",
          browser.js("document.querySelectorAll('#results img, #results b, #results script').length"), 0)
    browser.js("[...document.querySelectorAll('#results button')]"
               ".find((button) => button.textContent.includes('caf')).click()")
    await_text(browser, SUMMARY, "1 file found.")
    check("what is below the folder", browser.js(NAMES), ["na\\357ve.txt"])
    browser.js("document.getElementById('filters').open = true")
    check("the folder's field", browser.js("document.getElementById('below').value"),
          f"{folder}/caf\\351 & co")
    look_for(browser, "harbour")
    await_text(browser, SUMMARY, "Nothing was found.")
    look_for(browser, "light*")  # The field shows what it cannot hold, and the folder is still meant.
    await_text(browser, SUMMARY, "1 file found.")
    check_width(browser, "the filters")
    browser.js("document.getElementById('larger').value = 'big'")
    look_for(browser, "lighthouse")
    await_text(browser, PROBLEM, "'big' is no size")
    browser.js("document.getElementById('clear').click()")
    await_text(browser, SUMMARY, "2 files found.")
    check("the problem that is over", browser.js(PROBLEM), "")
    browser.js("window.before = 'there'")
    browser.call("Page.reload")
    await_text(browser, "String(window.before)", "undefined")
    await_text(browser, SUMMARY, "2 files found.")


def use_folders(browser):
    browser.js("document.getElementById('to-folders').click()")
    await_text(browser, "document.querySelector('#folders h3')?.textContent", "infinished")
    browser.js("document.getElementById('hours').value = '4'; document.getElementById('pause').focus()")
    browser.keys("Enter")
    await_text(browser, "document.getElementById('pause').textContent", "Resume")
    await_text(browser, STATE, "Indexing is paused until")
    check_width(browser, "the folders")
    browser.keys("Enter")
    await_text(browser, "document.getElementById('pause').textContent", "Pause")
    await_text(browser, STATE, "Everything can be found.")
    browser.js("document.getElementById('to-search').click()")
    await_text(browser, SUMMARY, "2 files found.")


def main():
    url, folder = sys.argv[1:]
    address, key = url.split("#")
    browser = Browser()
    try:
        browser.shape(1000, 640)
        browser.call("Page.navigate", url=address)
        await_text(browser, FOCUS, "token")
        browser.call("Page.navigate", url=url)
        use_search(browser, folder)
        check("what of the token is in the address", browser.js("location.href.includes('token')"), False)
        use_folders(browser)

        requests = [event["params"]["request"] for event in browser.events
                    if event.get("method") == "Network.requestWillBeSent"]
        check("a request was seen", bool(requests), True)
        check("requests to others", [request["url"] for request in requests
                                     if not request["url"].startswith((address, "data:"))], [])
        token = key.removeprefix("token=")
        check("addresses with the token", [request["url"] for request in requests
                                           if token in request["url"]], [])
        errors = [event["params"] for event in browser.events
                  if event.get("method") in ("Log.entryAdded", "Runtime.exceptionThrown")]
        check("errors", [error for error in errors
                         if error.get("entry", {}).get("url", "").find("larger=big") < 0], [])
    finally:
        browser.close()
    print("\n".join(failures))
    sys.exit(1 if failures else 0)


main()
