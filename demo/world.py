"""A person's world for the demonstration: a home, a session bus, the contact application. Nothing outside it is touched."""

import json
import os
import shutil
import signal
import subprocess
import tempfile
import time


class Failure(Exception):
    """Something is not as it should be; the text says what."""


class Bus:
    """A private session bus."""

    def __init__(self, directory):
        config = os.path.join(directory, "bus.conf")
        with open(config, "w") as out:
            out.write(
                "<!DOCTYPE busconfig PUBLIC '-//freedesktop//DTD D-Bus Bus Configuration 1.0//EN' "
                "'http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd'>"
                f"<busconfig><type>session</type><listen>unix:dir={directory}</listen><auth>EXTERNAL</auth>"
                "<policy context='default'><allow send_destination='*' eavesdrop='true'/><allow eavesdrop='true'/>"
                "<allow own='*'/></policy></busconfig>")
        self.process = subprocess.Popen(
            ["dbus-daemon", f"--config-file={config}", "--nofork", "--print-address=1"],
            stdout=subprocess.PIPE, stderr=subprocess.DEVNULL, text=True)
        self.address = self.process.stdout.readline().strip()
        if not self.address:
            raise Failure("the private session bus did not start")

    def stop(self):
        self.process.terminate()
        self.process.wait()


class Person:
    """Somebody with a home and a bus of their own. `run` runs the contact application as this person."""

    def __init__(self, name, build, root):
        self.name = name
        self.build = os.path.abspath(build)
        self.home = os.path.join(root, name)
        for part in ("", "data", "state", "cache", "config", "run"):
            os.makedirs(os.path.join(self.home, part), mode=0o700, exist_ok=True)
        self.bus = Bus(os.path.join(self.home, "run"))
        self.environment = {
            "PATH": os.environ.get("PATH", "/usr/bin:/bin") + ":/usr/sbin:/sbin",
            "HOME": self.home,
            "LANG": "C.UTF-8",
            "XDG_DATA_HOME": os.path.join(self.home, "data"),
            "XDG_STATE_HOME": os.path.join(self.home, "state"),
            "XDG_CACHE_HOME": os.path.join(self.home, "cache"),
            "XDG_CONFIG_HOME": os.path.join(self.home, "config"),
            "XDG_RUNTIME_DIR": os.path.join(self.home, "run"),
            "DBUS_SESSION_BUS_ADDRESS": self.bus.address,
            "ROLVANE_MANAGER": os.path.join(self.build, "src/daemon/RolvaneManager"),
            "ROLVANE_LOG": "stderr",
            "ROLVANE_NEWS": "never",  # each step shows what it has caused itself; bench/news.py takes it out
        }
        self.program = os.path.join(self.build, "apps/rolvane/rolvane")

    def start(self, *arguments, **more):
        return subprocess.Popen([self.program, *arguments], env=self.environment, text=True, **more)

    def run(self, *arguments, stdin="", may=(0,)):
        """Runs the contact application to its end; its standard output. Fails on an exit code that may not be."""
        done = subprocess.run([self.program, *arguments], env=self.environment, input=stdin, text=True,
                              capture_output=True, timeout=600)
        if done.returncode not in may:
            raise Failure(f"`rolvane {' '.join(arguments)}` ended with {done.returncode}: {done.stderr.strip()}")
        return done.stdout

    def fails(self, *arguments):
        """Exit code and standard error of a command that may end as it likes."""
        done = subprocess.run([self.program, *arguments], env=self.environment, input="", text=True, capture_output=True,
                              timeout=600)
        return done.returncode, done.stderr.strip()

    def json(self, *arguments, **more):
        return json.loads(self.run(*arguments, "--json", **more))

    def daemon(self):
        """The daemon's process number, or None."""
        return self.json("daemon", "status", may=(0, 3))["process"]

    def leave(self):
        self.run("daemon", "stop", may=(0, 1))
        self.bus.stop()


class World:
    """Everything of one run, gone at its end."""

    def __init__(self):
        self.root = tempfile.mkdtemp(prefix="rolvane-demo-")
        os.chmod(self.root, 0o711)
        self._ends = []

    def at_end(self, action):
        self._ends.append(action)

    def __enter__(self):
        signal.signal(signal.SIGTERM, lambda *_: (_ for _ in ()).throw(KeyboardInterrupt()))
        return self

    def __exit__(self, *_):
        for action in reversed(self._ends):
            try:
                action()
            except Exception as error:  # the other ends are still to come
                print(f"  clean-up: {error}")
        shutil.rmtree(self.root, ignore_errors=True)


def wait_until(test, seconds, what):
    """Asks again and again until the test gives something; fails with what the test said last."""
    end = time.monotonic() + seconds
    while True:
        try:
            found, said = test()
        except AssertionError as error:  # the store was not ready to answer; asked again
            found, said = False, str(error)
        if found and time.monotonic() <= end:
            return
        if time.monotonic() > end:
            raise Failure(f"{what}: {'it took too long' if found else said} after {seconds} seconds")
        time.sleep(0.005)
