#!/usr/bin/env python3
"""usage: signin.py BUILD

CPU time of httpd for a request by a user whose password is kept as bcrypt, on kept and on new connections: with the private store's own
provider, which computes the hash once for a user, and with httpd's, which computes it at every request. Prints both."""

import json
import os
import shutil
import subprocess
import sys
import tempfile

from benchworld import Process, wait_until

PASSWORD = "a long word"
REQUESTS = {"davacl": 2000, "file": 100}


def cpu_of_a_request(process, port, requests, kept):
    """Microseconds, measured over so many requests; the first one, before, has signed in."""
    command = ["ab", "-q", "-c", "4", *(["-k"] if kept else []), "-A", f"alice:{PASSWORD}"]
    url = f"http://127.0.0.1:{port}/dav/alice/x"
    subprocess.run([*command, "-n", "4", url], capture_output=True, check=True)
    before = process.cpu()
    said = subprocess.run([*command, "-n", str(requests), url], capture_output=True, text=True, check=True).stdout
    if "Non-2xx" in said or "Failed requests:        0" not in said:
        raise SystemExit(f"signin: requests were refused\n{said}")
    return (process.cpu() - before) / requests * 1e6


def main(build):
    top = tempfile.mkdtemp(prefix="rolvane-signin-", dir="/dev/shm" if os.path.isdir("/dev/shm") else None)
    directory, environment = f"{top}/store", {**os.environ, "HOME": top}

    def rolvane(*arguments, text=None):
        return subprocess.run([f"{build}/apps/rolvane/rolvane", "store", *arguments, "--directory", directory], input=text,
                              text=True, capture_output=True, check=True, env=environment).stdout

    def measure(provider, number, port):
        for kept in (True, False):
            used = cpu_of_a_request(Process(number), port, REQUESTS[provider], kept)
            print(f"{provider:>6}, {'kept' if kept else 'new '} connections: {used:8.0f} us of httpd's CPU a request", flush=True)

    plain = None
    os.chmod(top, 0o755)
    try:
        rolvane("user", "add", "alice", text=PASSWORD + "\n")
        rolvane("start", "--no-tls", "--no-http2")
        store = json.loads(rolvane("status", "--json"))
        port = store["port"]
        subprocess.run(["curl", "-sf", "-o", "/dev/null", "-u", f"alice:{PASSWORD}", "-T", "/etc/hostname",
                        f"http://127.0.0.1:{port}/dav/alice/x"], check=True)
        with open(f"{directory}/run/httpd.pid") as file:
            measure("davacl", int(file.read()), port)
        rolvane("stop", "--now")
        with open(f"{directory}/conf/httpd.conf") as file:
            text = file.read()
        changed = text.replace("AuthBasicProvider davacl", f'AuthBasicProvider file\n    AuthUserFile "{directory}/conf/passwords"')
        if changed == text:
            raise SystemExit("signin: the store's configuration names no provider")
        with open(f"{directory}/conf/plain.conf", "w") as file:
            file.write(changed)
        os.chmod(f"{directory}/conf/plain.conf", 0o644)
        owner = os.stat(f"{directory}/lists")  # httpd's user, who is not root
        plain = subprocess.Popen(["/usr/sbin/apache2", "-d", directory, "-f", f"{directory}/conf/plain.conf", "-DFOREGROUND"],
                                 **({"user": owner.st_uid, "group": owner.st_gid, "extra_groups": []} if os.geteuid() == 0 else {}))
        answered = ["curl", "-s", "-o", "/dev/null", f"http://127.0.0.1:{port}/"]
        wait_until(lambda: (subprocess.run(answered).returncode == 0, "no answer"), 20, "httpd to answer")
        measure("file", plain.pid, port)
    finally:
        if plain:
            plain.terminate()
            plain.wait()
        subprocess.run([f"{build}/apps/rolvane/rolvane", "store", "stop", "--now", "--directory", directory], env=environment,
                       capture_output=True)
        shutil.rmtree(top, ignore_errors=True)


if __name__ == "__main__":
    main(sys.argv[1])
