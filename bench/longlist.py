#!/usr/bin/env python3
"""usage: longlist.py BUILD

A listing of 10,000 members for somebody who comes last of 1,000 in the owner's access list, against the same listing by the same httpd
without mod_davacl's lists. Prints the ratio of the medians; exit code 1 when it is over 1.2."""

import json
import os
import shutil
import statistics
import subprocess
import sys
import tempfile

from benchworld import wait_until

MEMBERS, ENTRIES, ROUNDS, MOST = 10_000, 1_000, 15, 1.2
PASSWORD = "a long word"
GRANT = ('<D:acl xmlns:D="DAV:"><D:ace><D:principal><D:href>/principals/users/bob</D:href></D:principal>'
         '<D:grant><D:privilege><D:read/></D:privilege></D:grant></D:ace></D:acl>')
QUESTION = ('<D:propfind xmlns:D="DAV:"><D:prop><D:getlastmodified/><D:getetag/><D:resourcetype/>'
            '<D:getcontentlength/></D:prop></D:propfind>')


def asked(url, user, method, *more):
    """Status, seconds and bytes of one request."""
    said = subprocess.run(["curl", "-s", "-o", "/dev/null", "-w", "%{http_code} %{time_total} %{size_download}", "-u",
                           f"{user}:{PASSWORD}", "-X", method, *more, url], capture_output=True, text=True).stdout.split()
    return int(said[0]), float(said[1]), int(said[2])


def listing(url):
    status, seconds, size = asked(url, "bob", "PROPFIND", "-H", "Depth: 1", "-d", QUESTION)
    if status != 207 or size < 100 * MEMBERS:
        raise SystemExit(f"longlist: {url} answered {status} with {size} bytes")
    return seconds


def lengthen(lists):
    """Everybody else comes before the one who asks."""
    path = os.path.join(lists, "alice.acl")
    with open(path) as file:
        head, entry, end = file.read().splitlines()
    others = [entry.replace("user bob", f"user other{i:04}") for i in range(ENTRIES - 1)]
    with open(path, "w") as file:
        file.write("\n".join([head, *others, entry, end]) + "\n")


def without_lists(directory, port):
    """The same httpd beside the first one, in which everybody who is signed in may do everything."""
    with open(f"{directory}/conf/httpd.conf") as file:
        text = file.read()
    other = str(int(port) + 1)
    for former, new in (("Define ACCESSLISTS\n", ""), (f":{port}", f":{other}"), ("run/httpd.pid", "run/plain.pid"),
                        ("<IfDefine !ACCESSLISTS>\n    Require all denied",
                         "<IfDefine !ACCESSLISTS>\n    Require valid-user")):
        if former not in text:
            raise SystemExit(f"longlist: the store's configuration has no {former!r}")
        text = text.replace(former, new)
    with open(f"{directory}/conf/plain.conf", "w") as file:
        file.write(text)
    return subprocess.Popen(["/usr/sbin/apache2", "-f", f"{directory}/conf/plain.conf", "-DFOREGROUND"]), other


def main(build):
    top = tempfile.mkdtemp(prefix="rolvane-longlist-", dir="/dev/shm" if os.path.isdir("/dev/shm") else None)
    directory, plain = f"{top}/store", None
    environment = {**os.environ, "HOME": top}

    def rolvane(*arguments, text=None):
        return subprocess.run([f"{build}/apps/rolvane/rolvane", "store", *arguments, "--directory", directory], input=text,
                              text=True, capture_output=True, check=True, env=environment).stdout

    try:
        for user in ("alice", "bob"):
            rolvane("user", "add", user, text=PASSWORD + "\n")
        rolvane("start", "--no-tls", "--no-http2")
        store = json.loads(rolvane("status", "--json"))
        url, port = store["url"], str(store["port"])
        for user in ("alice", "bob"):
            asked(f"{url}/{user}/c/", user, "MKCOL")
            for i in range(MEMBERS):
                with open(f"{store['documents']}/dav/{user}/c/file{i:05}", "w") as file:
                    file.write("x" * 100)
        asked(f"{url}/alice/c/", "alice", "ACL", "-d", GRANT)
        lengthen(f"{directory}/lists")
        plain, other = without_lists(directory, port)
        plain_url = url.replace(port, other)
        wait_until(lambda: (asked(f"{plain_url}/bob/c/", "bob", "OPTIONS")[0] == 200, "no answer"), 30, "the second httpd")
        times = [(listing(f"{url}/alice/c/"), listing(f"{plain_url}/bob/c/")) for _ in range(ROUNDS)]
        with_list, without = (statistics.median(each) for each in zip(*times))
        print(f"a listing of {MEMBERS} members, last of {ENTRIES} in the list: {with_list:.3f} s; without lists "
              f"{without:.3f} s; ratio {with_list / without:.2f}")
        return 0 if with_list / without <= MOST else 1
    finally:
        if plain:
            plain.terminate()
            plain.wait()
        subprocess.run([f"{build}/apps/rolvane/rolvane", "store", "stop", "--directory", directory], capture_output=True,
                       env=environment)
        shutil.rmtree(top, ignore_errors=True)


if __name__ == "__main__":
    sys.exit(main(os.path.abspath(sys.argv[1])))
