"""What a subscriber waits for: the first pass over somebody's tree, against clients that only fetch the same files, and
a pass that finds nothing new, against a client that only lists the same tree."""

import base64
import collections
import json
import os
import re
import shutil
import statistics
import subprocess
import time

from benchworld import PASSWORD, Delay, Failure, Person, Process, busy_seconds, children_cpu
from clients import hidden_password

CONTACT = re.compile(r"/People/\d+/.")
CONNECTIONS, STREAMS = 10, 100  # over HTTP/1.1, and on the one connection over HTTP/2
NEAR_AIM, FAR_AIM, NOTHING_AIM = 0.65, 0.9, 3.0
MEMORY_LIMIT, MEMORY_PEOPLE = 300, 50000
RCLONE_FILES, PEER_FILES = 200, 10000  # so many tell a client's rate, however many more the tree holds
ROUNDS = {1000: 3}  # on loopback; otherwise 1. Everybody's fastest counts.
RCLONE_ROUNDS = {10000: 3}  # of the comparison with nothing new; otherwise 1

Entry = collections.namedtuple("Entry", "time user method status bytes path")


def entries(store, since, user):
    """What the log says of the user's requests since it had that size."""
    with open(store.log) as lines:
        lines.seek(since)
        found = [line.rstrip("\n").split(None, 5) for line in lines]
    return [Entry(float(w[0]), w[1], w[2], int(w[3]), int(w[4]), w[5]) for w in found if len(w) == 6 and w[1] == user]


def by_method(requests):
    return dict(sorted(collections.Counter(r.method for r in requests).items()))


class Measuring:
    """The time and the CPU of everybody, from its making to `done`."""

    def __init__(self, store):
        self.store = store
        self.log, self.server, self.busy = store.log_size(), store.process.cpu(), busy_seconds()
        self.children, self.began = children_cpu(), time.monotonic()

    def done(self):
        wall, server = time.monotonic() - self.began, self.store.process.cpu() - self.server
        own, busy = children_cpu() - self.children, busy_seconds() - self.busy
        return {"wall": wall, "server_cpu": server, "cpu": own, "busy": busy}


class Subscriber(Person):
    """Somebody with an account and no contacts."""

    def __init__(self, name, build, root, store, port, protocol):
        super().__init__(name, build, root)
        self.environment["ROLVANE_HTTP2"] = "always" if protocol == "h2" else "never"
        self.store = store
        self.run("account", "set", "--user", name, "--endpoint", store.endpoint.replace(f":{store.port}/", f":{port}/"),
                 "--ca-file", store.authority, "--ask-password", stdin=PASSWORD + "\n")

    def settled_cpu(self):
        """The daemon's CPU seconds when it has nothing left to do; what follows the end of a pass belongs to it."""
        used = self.manager().cpu()
        while True:
            time.sleep(0.2)
            if (now := self.manager().cpu()) == used:
                return now
            used = now

    def manager(self):
        number = self.daemon()
        if number is None:
            raise Failure(f"{self.name}'s daemon is not running")
        return Process(number)

    def first_pass(self, publisher, count):
        measuring = Measuring(self.store)
        self.run("subscribe", publisher, "--timeout", "3000")
        took = measuring.done()
        daemon = self.settled_cpu()
        here = self.json("subscriptions")[0]["people"]
        if here != count:
            raise Failure(f"{here} of {count} people have come")
        requests = entries(self.store, measuring.log, self.name)
        own = [r for r in requests if CONTACT.search(r.path)]
        gets = [r for r in own if r.method == "GET"]
        counts = collections.Counter(r.path for r in own)
        if len(gets) != count or len(counts) != count or len(own) != count:
            raise Failure(f"{len(own)} requests ({by_method(own)}) for {count} contacts; {counts.most_common(2)}")
        if any(r.status != 200 for r in gets):
            raise Failure("a contact was not read at once")
        times = [r.time for r in gets]
        return {"wall": took["wall"], "phase": max(times) - min(times), "cpu": daemon, "server_cpu": took["server_cpu"],
                "other_cpu": max(0.0, took["busy"] - took["server_cpu"] - took["cpu"] - daemon),
                "peak_megabytes": self.manager().peak_megabytes(), "files": count,
                "other_requests": by_method([r for r in requests if not CONTACT.search(r.path)])}

    def nothing_new(self):
        daemon = self.settled_cpu()
        measuring = Measuring(self.store)
        self.run("sync")
        took = measuring.done()
        requests = entries(self.store, measuring.log, self.name)
        if any(CONTACT.search(r.path) for r in requests):
            raise Failure("a pass with nothing new asked for a contact")
        return {"wall": took["wall"], "cpu": self.settled_cpu() - daemon, "server_cpu": took["server_cpu"],
                "command_cpu": took["cpu"], "requests": by_method(requests), "bytes": sum(r.bytes for r in requests)}


def measured(store, user, command, expected, **more):
    """A client that reads; what it took, and the requests that it sent."""
    measuring = Measuring(store)
    done = subprocess.run(command, capture_output=True, text=True, timeout=3000, **more)
    took = measuring.done()
    if done.returncode != 0:
        raise Failure(f"{command[0]} ended with {done.returncode}: {done.stderr.strip()[-400:]}")
    for _ in range(20):  # a request is written down a little after its answer
        requests = entries(store, measuring.log, user)
        gets = [r for r in requests if r.method == "GET" and r.status == 200]
        if len(gets) == expected:
            break
        time.sleep(0.05)
    else:
        raise Failure(f"{command[0]} fetched {len(gets)} of {expected} files")
    return {"wall": took["wall"], "cpu": took["cpu"], "server_cpu": took["server_cpu"], "files": expected,
            "other_cpu": max(0.0, took["busy"] - took["server_cpu"] - took["cpu"]),
            "requests": by_method(requests), "bytes": sum(r.bytes for r in requests)}, done.stdout


class Tree:
    """A published tree, and the files that are fetched from it."""

    def __init__(self, store, user, count, root):
        self.store, self.user, self.count, self.root = store, user, count, root
        self.names = [name for name, _, _ in sorted(store.files(user))]
        self.read = self.names[::-(-count // PEER_FILES)]  # from all buckets
        self.login = f"{user}:{PASSWORD}"

    def url(self, port):
        return self.store.url(self.user, port)

    def _script(self, name, text):
        path = os.path.join(self.root, name)
        with open(os.open(path, os.O_CREAT | os.O_WRONLY | os.O_TRUNC, 0o600), "w") as out:
            out.write(text)
        return path

    def raw(self, port, protocol):
        """h2load. Each of its connections asks for the same files, from the first one on. The rate is its own, from
        the first connection to the last answer."""
        count = len(self.read)
        urls = self._script("h2load.urls", "".join(f"{self.url(port)}/{name}\n" for name in self.read))
        key = base64.b64encode(self.login.encode()).decode()
        width = ["--h1", "-c", str(CONNECTIONS)] if protocol == "h1" else ["-c", "1", "-m", str(STREAMS)]
        result, said = measured(self.store, self.user, ["h2load", "-n", str(count), "-i", urls, "-H",
                                                        f"authorization: Basic {key}", *width], count)
        os.unlink(urls)
        rate = re.search(r"finished in [^,]*, ([0-9.]+) req/s", said)
        if not rate or f"{count} succeeded" not in said:
            raise Failure(f"h2load did not get everything: {said[-600:]}")
        result["wall"] = count / float(rate[1])
        return result

    def curl(self, port, protocol):
        text = f'user = "{self.login}"\nbasic\ncacert = "{self.store.authority}"\n'
        text += "".join(f'url = "{self.url(port)}/{name}"\noutput = "/dev/null"\n' for name in self.read)
        script = self._script("curl.conf", text)
        width = ["--http1.1", "--parallel-max", str(CONNECTIONS)] if protocol == "h1" else \
            ["--http2", "--parallel-max", str(STREAMS)]
        result, _ = measured(self.store, self.user, ["curl", "--silent", "--show-error", "--fail", "--globoff",
                                                     "--parallel", *width, "--config", script], len(self.read))
        os.unlink(script)
        return result

    def _rclone(self, port, *arguments, expected):
        environment = {**os.environ, "RCLONE_CONFIG": os.devnull, "RCLONE_CONFIG_STORE_TYPE": "webdav",
                       "RCLONE_CONFIG_STORE_URL": self.url(port), "RCLONE_CONFIG_STORE_USER": self.user,
                       "RCLONE_CONFIG_STORE_PASS": hidden_password()}
        return measured(self.store, self.user, ["rclone", *arguments, "--ca-cert", self.store.authority,
                                                "--transfers", str(CONNECTIONS), "--checkers", str(CONNECTIONS)],
                        expected, env=environment)[0]

    def rclone(self, port):
        names = self.names[:RCLONE_FILES]
        wanted = self._script("rclone.list", "".join(name + "\n" for name in names))
        target = os.path.join(self.root, "rclone-copy")
        try:
            return self._rclone(port, "copy", "--files-from-raw", wanted, "store:", target, expected=len(names))
        finally:
            os.unlink(wanted)
            shutil.rmtree(target, ignore_errors=True)

    def rclone_nothing(self, times):
        """`rclone sync` to a directory that holds all of it already; the median of several."""
        target = os.path.join(self.root, "rclone-copy")
        shutil.copytree(self.store.tree(self.user), target, ignore=shutil.ignore_patterns(".DAV", ".state"))
        try:
            runs = [self._rclone(self.store.port, "sync", "--exclude", ".state", "store:", target, expected=0)
                    for _ in range(times)]
        finally:
            shutil.rmtree(target, ignore_errors=True)
        return sorted(runs, key=lambda run: run["wall"])[len(runs) // 2]


class Subscription:
    """The part "subscription" of the benchmarks."""

    FAR = {1000: "h1", 10000: "h2"}

    def __init__(self, bench, quick, sizes):
        self.bench, self.quick, self.sizes, self.store = bench, quick, sizes, bench.store
        self.made, self.names = 0, []
        self.results = {"first": [], "nothing": []}

    def run(self):
        for count in self.sizes:
            if self.bench.is_late(f"subscription of {count}"):
                continue
            publisher = self.bench.publisher(count, 10)
            publisher.publish()
            self.invite(publisher, 2 * self.rounds(count) + (2 if count in self.FAR else 0))
            publisher.run("daemon", "stop")  # it would look at the tree from time to time
            tree = Tree(self.store, publisher.name, count, self.bench.root)
            self.near(tree)
            if count in self.FAR:
                self.far(tree, self.FAR[count])
            self.bench.dismiss(publisher)
        return self.results

    def rounds(self, count):
        return 1 if self.quick else ROUNDS.get(count, 1)

    def invite(self, publisher, count):
        """Accounts that may read the tree, made before anything is measured."""
        self.names = [f"s{self.made + i}" for i in range(count)]
        self.made += count
        for name in self.names:
            self.store.add_user(name)
            publisher.run("share", name)

    def subscriber(self, port, protocol):
        return self.bench.person(Subscriber, self.names.pop(), self.bench.build, self.bench.root, self.store, port,
                                 protocol)

    def dismiss(self, person):
        self.bench.people.remove(person)
        person.leave()
        shutil.rmtree(person.home, ignore_errors=True)

    def near(self, tree):
        self.heading(f"{tree.count} people, loopback")
        for protocol in ("h1", "h2"):
            if self.bench.is_late(f"subscription of {tree.count}, {protocol}"):
                continue
            row = {"people": tree.count, "protocol": protocol, "round_trip_ms": 0}
            others = ("raw", "curl", "rclone") if tree.count == 1000 and protocol == "h1" else ("raw", "curl")
            for i in range(self.rounds(tree.count)):
                person = self.round(tree, row, others, self.store.port)
                if protocol == "h1" and tree.count > 1000 and i == 0:
                    self.nothing(tree, person)
                self.dismiss(person)
            self.finish(row)
            if tree.count == MEMORY_PEOPLE:
                peak = row["ours"]["peak_megabytes"]
                self.bench.limit(peak < MEMORY_LIMIT,
                                 f"memory of the daemon after a first pass of {tree.count} people: {peak:.0f} MB")

    def far(self, tree, protocol):
        for milliseconds in (20, 100):
            if self.bench.is_late(f"subscription of {tree.count} behind {milliseconds} ms"):
                continue
            self.heading(f"{tree.count} people, {milliseconds} ms")
            row = {"people": tree.count, "protocol": protocol, "round_trip_ms": milliseconds}
            with Delay(self.bench.build, self.store.port, milliseconds) as delay:
                self.dismiss(self.round(tree, row, ("raw", "curl", "rclone"), delay.port))
            self.finish(row)

    def round(self, tree, row, others, port):
        def keep(name, result, key):
            if name not in row or result[key] < row[name][key]:
                row[name] = result

        for other in others:
            if other == "rclone":
                if "rclone" not in row:
                    keep("rclone", tree.rclone(port), "wall")
            else:
                keep(other, getattr(tree, other)(port, row["protocol"]), "wall")
        person = self.subscriber(port, row["protocol"])
        keep("ours", person.first_pass(tree.user, tree.count), "wall")
        return person

    def heading(self, text):
        self.bench.heading_of(f"First pass of a subscriber: {text}")
        print("  people proto ms | files/s: GETs all | ratio to raw: GETs, all, cpu | curl -Z: same | rclone: same | "
              "CPU µs a contact: daemon, server; raw: client, server | peak MB | other load in CPUs", flush=True)

    def finish(self, row):
        ours, count = row["ours"], row["people"]
        words = [f"{count:>6} {row['protocol']:>3} {row['round_trip_ms']:>4}",
                 f"{count / ours['phase']:>6.0f} {count / ours['wall']:>6.0f}"]
        for other in ("raw", "curl", "rclone"):
            if other not in row:
                words.append(f"{'':>4} {'':>4} {'':>4}")
                continue
            theirs = row[other]
            rate = theirs["files"] / theirs["wall"]
            cpu = (theirs["cpu"] + theirs["server_cpu"]) / theirs["files"] * count / (ours["cpu"] + ours["server_cpu"])
            words.append(f"{count / ours['phase'] / rate:>4.2f} {count / ours['wall'] / rate:>4.2f} {cpu:>4.2f}")
        per = [1e6 * row[who][key] / row[who]["files"] for who in ("ours", "raw") for key in ("cpu", "server_cpu")]
        words.append(" ".join(f"{used:>4.0f}" for used in per))
        words.append(f"{ours['peak_megabytes']:>4.0f}")
        words.append(f"{ours['other_cpu'] / ours['wall']:.1f}")
        print("  " + " | ".join(words), flush=True)
        print(f"    one GET a contact and no other request for any; the rest: {ours['other_requests']}", flush=True)
        aim = FAR_AIM if row["round_trip_ms"] else NEAR_AIM
        rate = row["raw"]["files"] / row["raw"]["wall"]
        for key, what in (("phase", "GETs"), ("wall", "whole command")):
            self.bench.aim(count / ours[key] / rate, aim,
                           f"first pass over {count} people, {row['protocol']}, {row['round_trip_ms']} ms, {what}")
        self.results["first"].append(row)

    def nothing(self, tree, person):
        runs = [person.nothing_new() for _ in range(5)]
        ours = {**sorted(runs, key=lambda run: run["wall"])[len(runs) // 2],
                "wall": statistics.median(run["wall"] for run in runs),
                "cpu": statistics.mean(run["cpu"] for run in runs),
                "server_cpu": statistics.mean(run["server_cpu"] for run in runs)}
        theirs = tree.rclone_nothing(RCLONE_ROUNDS.get(tree.count, 1))
        for name, row in (("ours", ours), ("rclone sync", theirs)):
            print(f"    nothing new, {name:>11}: {row['wall']:.3f} s, client {row['cpu']:.3f} s and server "
                  f"{row['server_cpu']:.3f} s of CPU, {row['bytes']} bytes, {json.dumps(row['requests'])}", flush=True)
        self.bench.aims.append((ours["wall"] * NOTHING_AIM <= theirs["wall"],
                                f"nothing new among {tree.count} people: {ours['wall']:.3f} s, rclone sync "
                                f"{theirs['wall']:.3f} s (aim: a third of it)"))
        self.results["nothing"].append({"people": tree.count, "ours": ours, "rclone": theirs})
