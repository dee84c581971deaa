#!/usr/bin/env python3
"""A session recorded the way a user records one (tavrind in a temporary root, tavrinctl's shell),
drawn with `tavrinctl report`, and opened in headless Chromium. Checks that the browser logs no
console message (the page has no script, so any message is an SVG or HTML fault), that the DOM it
builds holds one timeline mark per stored message of each lane up to the cap, and that its
screenshot shows the drawing (the report's own colours, not a blank page).

Usage: ReportInChromiumTest.py TAVRIND TAVRINCTL [--keep-screenshot PATH]
Exits 77 (skipped) when Chromium is not installed."""

import argparse
import collections
import html.parser
import json
import os
import shutil
import sqlite3
import struct
import subprocess
import sys
import tempfile
import time
import zlib

CAP = 2000  # marks drawn per lane at most (tavrinctl's kReportCap)
REPORTER = 4242
LANES = {(2, 1): 2600, (3, 0): 40}  # client messages per (category, type); the first is thinned
WIDTH, HEIGHT = 1000, 900


def fail(message):
    print("FAIL: " + message)
    sys.exit(1)


def record_session(ctl, root):
    """Runs one session through tavrinctl's shell; the Speaker counters rise while it runs."""
    counter = os.path.join(root, "driverstats", "Speaker", "xruns")
    os.makedirs(os.path.dirname(counter))
    with open(counter, "w") as f:
        f.write("5\n")
    lines = [f"create {REPORTER}", f"set-type {REPORTER} haptics", f"start {REPORTER}"]
    for i in range(LANES[(2, 1)]):
        level = {"level": i % 97, "gain": round(0.5 + (i % 13) / 10, 2)}
        lines.append(f"send {json.dumps(level)} -c 2 -t 1 --to {REPORTER}")
    for i in range(LANES[(3, 0)]):
        lines.append(f'send {{"route": "speaker", "buffers": {i * 3}}} -c 3 -t 0 --to {REPORTER}')
    orientation = {"device_orientation": "portrait,landscape,portrait",
                   "device_orientation_time": "0,0.1,0.2"}
    lines.append(f"send {json.dumps(orientation)} -c 3 -t 0 --to {REPORTER}")
    lines.append(f"valid {REPORTER}")  # answered once the start's snapshot is taken
    output = os.path.join(root, "shell.out")
    with open(output, "w") as out:
        shell = subprocess.Popen([ctl, "--json", "--root", root, "shell"], stdin=subprocess.PIPE,
                                 stdout=out, stderr=subprocess.STDOUT, text=True)
        shell.stdin.write("\n".join(lines) + "\n")
        shell.stdin.flush()
        deadline = time.monotonic() + 60
        while '"operation":"valid"' not in open(output).read():
            if time.monotonic() > deadline or shell.poll() is not None:
                fail("the shell did not get through its sends:\n" + open(output).read()[-2000:])
            time.sleep(0.05)
        with open(counter + ".tmp", "w") as f:
            f.write("12\n")
        os.rename(counter + ".tmp", counter)
        shell.stdin.write(f"stop {REPORTER}\nquit\n")
        shell.stdin.close()
        if shell.wait(timeout=60) != 0:
            fail("tavrinctl shell failed:\n" + open(output).read()[-2000:])


def stored_lanes(database):
    """Message counts per (category, type) of the reporter's session, once its summary is in."""
    deadline = time.monotonic() + 30
    while time.monotonic() < deadline:
        with sqlite3.connect(f"file:{database}?mode=ro", uri=True) as db:
            rows = db.execute("SELECT category, type, COUNT(*) FROM session_messages "
                              "WHERE reporter_id = ? GROUP BY category, type ORDER BY category, "
                              "type", (REPORTER,)).fetchall()
        if (65535, 65535) in {(c, t) for c, t, _ in rows}:
            return {(c, t): n for c, t, n in rows}
        time.sleep(0.1)
    fail("the stopped session's summary never reached the store")


class MarksParser(html.parser.HTMLParser):
    """Marks per timeline lane (one "M" per mark in each path.marks) and the page's text."""

    def __init__(self):
        super().__init__()
        self.marks, self.polylines, self.text = [], [], []

    def handle_starttag(self, tag, attrs):
        attrs = dict(attrs)
        if tag == "path" and attrs.get("class") == "marks":
            self.marks.append(attrs.get("d", "").count("M"))
        if tag == "polyline":
            self.polylines.append(len(attrs.get("points", "").split()))

    def handle_data(self, data):
        self.text.append(data)


def chromium(browser, work, page, *arguments):
    profile = tempfile.mkdtemp(dir=work)
    run = subprocess.run([browser, "--headless", "--no-sandbox", "--disable-gpu",
                          "--hide-scrollbars", "--enable-logging=stderr", "--v=0",
                          f"--user-data-dir={profile}", f"--window-size={WIDTH},{HEIGHT}",
                          *arguments, "file://" + page], capture_output=True, text=True,
                         timeout=120, cwd=work)
    if run.returncode != 0:
        fail(f"chromium exited with {run.returncode}:\n{run.stderr[-3000:]}")
    console = [line for line in run.stderr.splitlines() if ":CONSOLE" in line]
    if console:
        fail("the page logged to the console:\n" + "\n".join(console))
    return run.stdout


def png_pixels(path):
    """(width, height, rows of RGB(A) tuples) of an 8-bit RGB or RGBA PNG, decoded with zlib."""
    data = open(path, "rb").read()
    if data[:8] != b"\x89PNG\r\n\x1a\n":
        fail(f"{path} is not a PNG")
    at, idat, header = 8, b"", None
    while at < len(data):
        length, kind = struct.unpack(">I4s", data[at:at + 8])
        body = data[at + 8:at + 8 + length]
        if kind == b"IHDR":
            header = struct.unpack(">IIBBBBB", body)
        elif kind == b"IDAT":
            idat += body
        at += 12 + length
    width, height, depth, colour, _, _, interlace = header
    if depth != 8 or colour not in (2, 6) or interlace:
        fail(f"unexpected PNG format: depth {depth}, colour type {colour}, interlace {interlace}")
    channels = 3 if colour == 2 else 4
    raw, stride = zlib.decompress(idat), width * channels
    rows, previous = [], bytearray(stride)
    for y in range(height):
        start = y * (stride + 1)
        kind, line = raw[start], bytearray(raw[start + 1:start + 1 + stride])
        for x in range(stride):
            a = line[x - channels] if x >= channels else 0
            b, c = previous[x], previous[x - channels] if x >= channels else 0
            if kind == 1:
                line[x] = (line[x] + a) & 255
            elif kind == 2:
                line[x] = (line[x] + b) & 255
            elif kind == 3:
                line[x] = (line[x] + (a + b) // 2) & 255
            elif kind == 4:
                p = a + b - c
                pa, pb, pc = abs(p - a), abs(p - b), abs(p - c)
                line[x] = (line[x] + (a if pa <= pb and pa <= pc else b if pb <= pc else c)) & 255
        rows.append([tuple(line[x:x + 3]) for x in range(0, stride, channels)])
        previous = line
    return width, height, rows


def main():
    parser = argparse.ArgumentParser()
    parser.add_argument("tavrind")
    parser.add_argument("tavrinctl")
    parser.add_argument("--keep-screenshot")
    args = parser.parse_args()
    browser = shutil.which("chromium") or shutil.which("chromium-browser")
    if not browser:
        print("SKIP: chromium is not installed (scripts/bootstrap.sh installs it)")
        sys.exit(77)
    ctl = args.tavrinctl
    work = tempfile.mkdtemp(prefix="tavrin-chromium-")
    root = os.path.join(work, "root")
    service = subprocess.Popen([args.tavrind, "--root", root],
                               stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
    try:
        for _ in range(400):
            if os.path.exists(os.path.join(root, "run", "reporting.sock")):
                break
            time.sleep(0.05)
        else:
            fail("tavrind made no socket")
        record_session(ctl, root)
        lanes = stored_lanes(os.path.join(root, "lib", "tavrin.db"))
        service.terminate()
        if service.wait(timeout=30) != 0:
            fail("tavrind did not end cleanly")
        expected = {**{lane: n + (lane == (3, 0)) for lane, n in LANES.items()},
                    (9, 0): 1, (65535, 65535): 1}
        if lanes != expected:
            fail(f"stored lanes {lanes}, expected {expected}")

        page = os.path.join(work, "session.html")
        subprocess.run([ctl, "--root", root, "report", "--reporter", str(REPORTER), "--output",
                        page], check=True, timeout=60)
        dom = MarksParser()
        dom.feed(chromium(browser, work, page, "--dump-dom"))
        text = " ".join(dom.text)
        want = [min(n, CAP) for _, n in sorted(lanes.items())]
        if dom.marks != want:
            fail(f"marks per lane in the DOM {dom.marks}, expected {want}")
        if f"{CAP} of {LANES[(2, 1)]} marks shown" not in text:
            fail("the thinned lane does not say so")
        # level and gain come with every message of the thinned lane; buffers with 40.
        if sorted(dom.polylines) != sorted([CAP, CAP, LANES[(3, 0)]]):
            fail(f"plot points in the DOM {dom.polylines}")
        if "Speaker_xruns" not in text:
            fail("the driver counter delta is missing")

        shot = os.path.join(work, "screenshot.png")
        chromium(browser, work, page, f"--screenshot={shot}")
        width, height, rows = png_pixels(shot)
        counts = collections.Counter(p for row in rows for p in row)
        background, most = counts.most_common(1)[0]
        drawn = width * height - most
        print(f"screenshot {width}x{height}: {len(counts)} colours, {drawn} pixels "
              f"({100 * drawn / (width * height):.1f}%) not background {background}")
        if (width, height) != (WIDTH, HEIGHT) or len(counts) < 16 or drawn < width * height // 20:
            fail("the screenshot is (nearly) blank")
        # Solid fills of the page: lane marks, orientation band, counter bar, plot background.
        for colour in ("1f5fa8", "8ecae6", "e76f51", "f6f6f6"):
            if counts[tuple(bytes.fromhex(colour))] < 20:
                fail(f"the screenshot shows (almost) no #{colour}")
        if args.keep_screenshot:
            shutil.copyfile(shot, args.keep_screenshot)
        print(f"lanes {sorted(lanes.items())}: marks {dom.marks}; no console message")
    finally:
        if service.poll() is None:
            service.kill()
            service.wait()
        shutil.rmtree(work, ignore_errors=True)


if __name__ == "__main__":
    main()
