"""A screen of its own (Xvfb) for a person's programs, and the session bus of a desktop. Pictures are taken of the whole."""

import os
import re
import shutil
import subprocess
import sys
import tempfile
import time

HERE = os.path.dirname(os.path.abspath(__file__))
SOURCE = os.path.dirname(os.path.dirname(HERE))
sys.path[:0] = [os.path.join(SOURCE, "demo"), os.path.join(SOURCE, "tests/interop")]
from world import Failure  # noqa: E402

WIDTH, HEIGHT = 1100, 760
PATIENCE = 90  # seconds for a window
FAILED = "/tmp/rolvane-pictures-failed.png"


class Screen:
    """An X server with a window manager, and a session bus that starts the services of those files alone."""

    def __init__(self, person, services=()):
        self.programs, directory = [], tempfile.mkdtemp(dir=person.environment["XDG_RUNTIME_DIR"])
        known = os.path.join(directory, "services")
        os.makedirs(known)
        for path in services:
            shutil.copy(path, known)
        config = os.path.join(directory, "desktop.conf")
        with open(config, "w") as out:
            out.write(f"<busconfig><type>session</type><listen>unix:dir={directory}</listen><servicedir>{known}</servicedir>"
                      "<policy context='default'><allow send_destination='*'/><allow eavesdrop='true'/><allow own='*'/>"
                      "</policy></busconfig>")
        receive, send = os.pipe()
        self.programs.append(subprocess.Popen(
            ["Xvfb", "-displayfd", str(send), "-screen", "0", f"{WIDTH}x{HEIGHT}x24", "-nolisten", "tcp"], pass_fds=(send,),
            stderr=subprocess.DEVNULL))
        os.close(send)
        with os.fdopen(receive) as said:
            display = said.readline().strip()
        self.environment = dict(
            person.environment, DISPLAY=f":{display}", GDK_BACKEND="x11", NO_AT_BRIDGE="1", GTK_A11Y="none",
            GSETTINGS_BACKEND="keyfile", LIBGL_ALWAYS_SOFTWARE="1", USER="ada", LOGNAME="ada")
        bus = self.start("dbus-daemon", f"--config-file={config}", "--nofork", "--print-address=1", stdout=subprocess.PIPE)
        self.environment["DBUS_SESSION_BUS_ADDRESS"] = bus.stdout.readline().strip()
        self.start("openbox")

    def start(self, *command, **more):
        process = subprocess.Popen(command, env=self.environment, text=True, stderr=subprocess.DEVNULL, **more)
        self.programs.append(process)
        return process

    def tool(self, *command):
        done = subprocess.run(command, env=self.environment, capture_output=True, timeout=PATIENCE)
        return done.stdout

    def window(self, title):
        """Waits for a window of that title."""
        end = time.monotonic() + PATIENCE
        while time.monotonic() < end:
            found = self.tool("xdotool", "search", "--onlyvisible", "--name", title).decode().split()
            if found:
                self.settle()
                return found[-1]
            time.sleep(0.2)
        self.fail(f"no window {title}")

    def fail(self, words):
        self.picture(FAILED)
        raise Failure(f"{words}; {FAILED} shows the screen")

    def settle(self):
        """Waits until the screen has stood still for a second; a cursor may blink."""
        before, still = None, 0
        for _ in range(PATIENCE * 4):
            now = self.tool("import", "-window", "root", "-resize", "25%", "-depth", "8", "gray:-")
            still = still + 1 if before and sum(abs(a - b) > 40 for a, b in zip(now, before)) < 20 else 0
            if still >= 4:
                return
            before = now
            time.sleep(0.25)

    def wait_for_line(self, path, pattern, words):
        """Waits until a log has such a line."""
        end = time.monotonic() + PATIENCE
        while not (os.path.exists(path) and re.search(pattern, open(path).read())):
            if time.monotonic() > end:
                self.fail(words)
            time.sleep(0.2)
        self.settle()

    def click(self, x, y, window=None):
        place = ["--window", window] if window else []
        self.tool("xdotool", "mousemove", *place, str(x), str(y), "click", "1")
        self.settle()

    def write(self, text):
        self.tool("xdotool", "key", "ctrl+a")
        self.tool("xdotool", "type", "--delay", "15", text)

    def key(self, *names):
        self.tool("xdotool", "key", "--delay", "60", *names)
        self.settle()

    def picture(self, path):
        self.tool("xdotool", "mousemove", str(WIDTH - 2), str(HEIGHT - 2))
        self.settle()
        self.tool("import", "-window", "root", "+dither", "-colors", "48", "-strip", "-depth", "8", path)
        print(f"  {path}", flush=True)

    def stop(self):
        for process in reversed(self.programs):
            process.terminate()
            try:
                process.wait(20)
            except subprocess.TimeoutExpired:
                process.kill()
                process.wait()
