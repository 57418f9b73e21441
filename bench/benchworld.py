"""What the benchmarks measure in: cards, a store on a tmpfs, people with daemons, and the counters of both sides."""

import collections
import json
import os
import re
import resource
import signal
import subprocess
import sys
import time
import urllib.parse

SOURCE = os.path.dirname(os.path.dirname(os.path.abspath(__file__)))
sys.path.insert(0, os.path.join(SOURCE, "demo"))
from world import Failure, Person, World, wait_until  # noqa: E402,F401

PASSWORD = "bench-and-nothing-else"
TICK = os.sysconf("SC_CLK_TCK")
signal.signal(signal.SIGTERM, lambda *_: sys.exit("ended, as the time was over"))  # by way of the clean-up


def write_cards(path, count):
    """A vCard file of so many people of the usual kind, about 1.5 kB each on the store; every tenth is in one of four
    groups."""
    with open(path, "w") as out:
        for i in range(count):
            group = f"CATEGORIES:Group {i // 10 % 4}\r\n" if i % 10 == 0 else ""
            out.write(
                f"BEGIN:VCARD\r\nVERSION:4.0\r\nUID:urn:uuid:{i:08x}-0000-4000-8000-000000000000\r\n"
                f"FN:Fräulein Numéro {i}\r\nN:Numéro {i};Fräulein;;;\r\nORG:Works {i % 97};Hall {i % 7}\r\n"
                f"TITLE:Keeper of number {i}\r\nTEL;TYPE=home:+49 30 {i:08}\r\nTEL;TYPE=work:+49 40 {i:08}\r\n"
                f"TEL;TYPE=cell:+49 170 {i:08}\r\nEMAIL;TYPE=home:n{i}@example.org\r\n"
                f"EMAIL;TYPE=work:number.{i}@works{i % 97}.example\r\n"
                f"ADR;TYPE=home:;;Long Lane {i};Town {i % 1013};;{i % 90000:05};Land\r\n"
                f"NOTE:Somebody of whom there are many.\\nThis one has the number {i}.\r\n{group}END:VCARD\r\n")


class Process:
    """CPU and memory of a process and its descendants."""

    def __init__(self, number):
        self.number = number

    def _family(self):
        children = collections.defaultdict(list)
        for name in os.listdir("/proc"):
            if name.isdigit():
                try:
                    with open(f"/proc/{name}/stat") as stat:
                        children[int(stat.read().rsplit(")", 1)[1].split()[1])].append(int(name))
                except OSError:
                    pass
        found, todo = [], [self.number]
        while todo:
            found.append(todo.pop())
            todo += children[found[-1]]
        return found

    def cpu(self):
        """Seconds so far, user and system."""
        total = 0
        for number in self._family():
            try:
                with open(f"/proc/{number}/stat") as stat:
                    fields = stat.read().rsplit(")", 1)[1].split()
                total += int(fields[11]) + int(fields[12])
                if number == self.number:  # and what its former children used
                    total += int(fields[13]) + int(fields[14])
            except OSError:
                pass
        return total / TICK

    def peak_megabytes(self):
        with open(f"/proc/{self.number}/status") as status:
            return int(re.search(r"VmHWM:\s+(\d+)", status.read())[1]) / 1024


def busy_seconds():
    """CPU seconds that the whole machine has spent so far."""
    with open("/proc/stat") as stat:
        fields = [int(word) for word in stat.readline().split()[1:9]]
    return (sum(fields) - fields[3] - fields[4]) / TICK


def children_cpu():
    usage = resource.getrusage(resource.RUSAGE_CHILDREN)
    return usage.ru_utime + usage.ru_stime


class Store:
    """The private store that all measurements share, and what it has been asked for."""

    def __init__(self, keeper):
        self.keeper = keeper
        status = keeper.json("store", "start", "--access-log")
        self.endpoint, self.authority = status["endpoint"], status["caFile"]
        self.log = os.path.join(os.path.dirname(status["errorLog"]), "access.log")
        self.documents, self.port = status["documents"], status["port"]
        self._learn_process()

    def url(self, user, port=None):
        url = self.endpoint.replace("{user}", user)
        return url.replace(f":{self.port}/", f":{port}/") if port else url

    def _learn_process(self):
        self.process = Process(self.keeper.json("store", "status")["process"])

    def add_user(self, name):
        self.keeper.run("store", "user", "add", name, stdin=PASSWORD + "\n")
        self._learn_process()  # the store may have started anew to know the user

    def tree(self, user):
        return self.documents + urllib.parse.urlsplit(self.url(user)).path

    def log_size(self):
        return os.path.getsize(self.log)

    def requests(self, since, user):
        """[(method, status, path)] of the user's requests since the log had that size."""
        with open(self.log) as lines:
            lines.seek(since)
            found = [line.split(None, 5) for line in lines]
        return [(words[2], int(words[3]), words[5].rstrip("\n")) for words in found
                if len(words) == 6 and words[1] == user]

    def files(self, user):
        """The contacts on the store: [(path below the tree, size, time of the last write)]."""
        found, people = [], os.path.join(self.tree(user), "People")
        for bucket in os.listdir(people):
            if not bucket.isdigit():
                continue
            for entry in os.scandir(os.path.join(people, bucket)):
                if entry.is_file():
                    stat = entry.stat()
                    found.append((f"People/{bucket}/{entry.name}", stat.st_size, stat.st_mtime_ns / 1e9))
        return found


class Delay:
    """The store at a distance; none for no milliseconds."""

    def __init__(self, build, port, milliseconds):
        self.process, self.port = None, None
        if milliseconds:
            self.process = subprocess.Popen([f"{build}/bench/delayproxy", str(port), str(milliseconds)],
                                            stdout=subprocess.PIPE, text=True)
            self.port = int(self.process.stdout.readline())

    def __enter__(self):
        return self

    def __exit__(self, *_):
        if self.process:
            self.process.terminate()
            self.process.wait()


class Publisher(Person):
    """Somebody with a database of so many people and an account on the store."""

    def __init__(self, name, build, root, store, count, workers, port=None):
        super().__init__(name, build, root)
        self.environment["ROLVANE_LOG"] = "stderr"
        self.store, self.count = store, count
        store.add_user(name)
        self.run("account", "set", "--user", name, "--endpoint",
                 store.endpoint.replace(f":{store.port}/", f":{port}/") if port else store.endpoint,
                 "--ca-file", store.authority, "--ask-password", stdin=PASSWORD + "\n")
        if workers:  # else as many as the daemon thinks best
            self.run("defaults", "write", "CXDThreadCountKey", str(workers), "--type", "int")
        cards = os.path.join(self.home, "cards.vcf")
        write_cards(cards, count)
        before = children_cpu()
        self.run("import", cards)
        self.import_cpu = children_cpu() - before
        os.unlink(cards)

    def manager(self):
        number = self.daemon()
        if number is None:
            raise Failure(f"{self.name}'s daemon is not running")
        return Process(number)

    def publish(self):
        """Publishes everything; what it took."""
        log, server, busy = self.store.log_size(), self.store.process.cpu(), busy_seconds()
        others = children_cpu()
        began = time.monotonic()
        self.run("publish", "--quiet", "--timeout", "3000")
        wall = time.monotonic() - began
        daemon = self.manager()
        cpu, server = daemon.cpu(), self.store.process.cpu() - server
        files = self.store.files(self.name)
        if len(files) != self.count:
            raise Failure(f"{len(files)} of {self.count} people are on the store")
        times = [written for _, _, written in files]
        return {"wall": wall, "phase": max(times) - min(times), "cpu": cpu, "server_cpu": server,
                "other_cpu": max(0.0, busy_seconds() - busy - cpu - server - (children_cpu() - others)),
                "peak_megabytes": daemon.peak_megabytes(), **self.counted(log)}

    def counted(self, log):
        """What the log says of a first publication, checked: one PUT a contact, and nothing else for any."""
        requests = self.store.requests(log, self.name)
        contact = re.compile(r"/People/\d+/.")
        by_contact = collections.Counter(path for _, _, path in requests if contact.search(path))
        puts = collections.Counter(path for method, _, path in requests if method == "PUT" and contact.search(path))
        refused = [entry for entry in requests if entry[1] == 401]
        if len(puts) != self.count or any(n != 1 for n in by_contact.values()):
            worst = by_contact.most_common(3)
            raise Failure(f"{len(puts)} of {self.count} contacts were written; most requested: {worst}")
        if refused:
            raise Failure(f"{len(refused)} requests were sent without a login first")
        rest = collections.Counter(method for method, _, path in requests if not contact.search(path))
        return {"contact_puts": sum(puts.values()), "other_requests": dict(rest)}


def put_table(name, lines):
    """Puts what a run has found into the place that has its name in the document that BENCH_DOCS names, if any."""
    path = os.environ.get("BENCH_DOCS")
    if not path:
        return
    with open(path) as document:
        text = document.read()
    begin, end = f"<!-- {name}: written by the benchmark -->\n", f"<!-- end of {name} -->"
    if text.count(begin) != 1 or text.find(end) < text.find(begin):
        raise Failure(f"{path} has no place for {name}")
    seen = f"{time.strftime('%F')}, {os.cpu_count()} processors, load {os.getloadavg()[0]:.1f}:"
    rest = text[text.find(end):]
    with open(path, "w") as document:
        document.write(text[:text.find(begin) + len(begin)] + "\n".join(["", seen, "", *lines, "", rest]))


def save_json(path, data):
    with open(path, "w") as out:
        json.dump(data, out, indent=1, sort_keys=True)
        out.write("\n")
