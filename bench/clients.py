"""The clients that a publication is compared with. Each puts the same bodies, the very files that the daemon wrote, into a
fresh tree with ready collections; what it took."""

import json
import os
import shutil
import subprocess
import time

from benchworld import PASSWORD, Failure, busy_seconds, children_cpu
from storeview import StoreView


class Bodies:
    """A copy of a user's published contacts, laid out as on the store."""

    def __init__(self, store, user, directory):
        self.directory = directory
        self.names = [name for name, _, _ in sorted(store.files(user))]
        shutil.copytree(os.path.join(store.tree(user), "People"), os.path.join(directory, "People"),
                        ignore=shutil.ignore_patterns(".DAV"))

    def first(self, count):
        return self.names[:count]


class Target:
    """A new user's empty tree."""

    _made = 0

    def __init__(self, store, port=None):
        Target._made += 1
        self.store, self.user = store, f"raw{Target._made}"
        self.login = f"{self.user}:{PASSWORD}"
        self.url = store.url(self.user, port)
        store.add_user(self.user)
        view = StoreView(store.url(self.user), self.user, PASSWORD, store.authority)
        for parts in ((), ("People",), *(("People", str(bucket)) for bucket in range(32))):
            status, _ = view.request("MKCOL", view.path(*parts) + "/")
            if status not in (201, 405):
                raise Failure(f"MKCOL {parts} was answered with {status}")

    def remove(self):
        shutil.rmtree(os.path.dirname(self.store.tree(self.user)), ignore_errors=True)


def measured(target, bodies, names, command, **more):
    """Runs a client and measures it from its start to its end."""
    server, busy, own = target.store.process.cpu(), busy_seconds(), children_cpu()
    began = time.monotonic()
    done = subprocess.run(command, capture_output=True, text=True, timeout=3000, **more)
    wall, cpu, server = time.monotonic() - began, children_cpu() - own, target.store.process.cpu() - server
    busy = busy_seconds() - busy
    if done.returncode != 0:
        raise Failure(f"{command[0]} ended with {done.returncode}: {done.stderr.strip()[-400:]}")
    written = {name: size for name, size, _ in target.store.files(target.user)}
    for name in names:
        if written.get(name) != os.path.getsize(os.path.join(bodies.directory, name)):
            raise Failure(f"{command[0]} did not write {name}")
    return {"files": len(names), "wall": wall, "cpu": cpu, "server_cpu": server,
            "other_cpu": max(0.0, busy - cpu - server)}, done.stdout


def raw(build, target, bodies, names, connections):
    """neon. The time is from the first connection to the last answer; reading the bodies is not in it."""
    result, said = measured(
        target, bodies, names, [f"{build}/bench/rawput", target.url, str(connections), bodies.directory,
                                target.store.authority],
        input="".join(name + "\n" for name in names), env={**os.environ, "BENCH_LOGIN": target.login})
    own = json.loads(said)
    return {**result, "wall": own["wall"], "cpu": own["cpu"]}


def curl(target, bodies, names, connections, directory):
    script = os.path.join(directory, "curl.conf")
    with open(os.open(script, os.O_CREAT | os.O_WRONLY | os.O_TRUNC, 0o600), "w") as out:
        out.write(f'user = "{target.login}"\nbasic\ncacert = "{target.store.authority}"\n')
        for name in names:
            out.write(f'url = "{target.url}/{name}"\nupload-file = "{bodies.directory}/{name}"\noutput = "/dev/null"\n')
    result, _ = measured(target, bodies, names, ["curl", "--silent", "--show-error", "--fail", "--globoff", "--http1.1",
                                                 "--parallel", "--parallel-max", str(connections), "--config", script])
    os.unlink(script)
    return result


def hidden_password():
    return subprocess.run(["rclone", "obscure", "-"], input=PASSWORD, capture_output=True, text=True,
                          check=True).stdout.strip()


def rclone(target, bodies, names, connections, directory):
    wanted = os.path.join(directory, "rclone.list")
    with open(wanted, "w") as out:
        out.writelines(name + "\n" for name in names)
    environment = {**os.environ, "RCLONE_CONFIG": os.devnull, "RCLONE_CONFIG_STORE_TYPE": "webdav",
                   "RCLONE_CONFIG_STORE_URL": target.url, "RCLONE_CONFIG_STORE_USER": target.user,
                   "RCLONE_CONFIG_STORE_PASS": hidden_password()}
    return measured(target, bodies, names,
                    ["rclone", "copy", "--files-from-raw", wanted, "--transfers", str(connections), "--checkers",
                     str(connections), "--ca-cert", target.store.authority, bodies.directory, "store:"],
                    env=environment)[0]
