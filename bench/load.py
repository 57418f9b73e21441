#!/usr/bin/env python3
"""usage: load.py BUILD [PEOPLE [SECONDS]]

What one httpd does for so many people (1,000), each with a daemon: a tree of 100 contacts that three others read, four
edits an hour, two looks an hour by itself, and a request that waits for news all the time. Of the daemons only the passes
are played, request by request, over TLS, on a new connection each as after a rest; two real daemons show first that their
passes are these. The hour is played at 1, 10, 20, 40 ... times its pace, each for SECONDS (20), until httpd uses half
of the machine, one pass of a hundred takes over a second, or something is refused. Prints, for each pace: passes and requests a second,
httpd's CPU, the latencies of whole passes, memory. Ends with 1 where 1,000 people at their own pace take more than half of
the machine, or a request is refused."""

import asyncio
import base64
import os
import random
import shutil
import ssl
import statistics
import sys
import time

from benchworld import PASSWORD, Failure, Person, Publisher, Store, World, busy_seconds, put_table, save_json
from news import megabytes

CONTACTS, READ, EDITS_AN_HOUR, LOOKS_AN_HOUR = 100, 3, 4, 2
MOST_OF_MACHINE, MOST_SECONDS = 0.5, 1.0
XML = "application/xml; charset=utf-8"
HEAD = '<?xml version="1.0" encoding="utf-8"?>\n'
TOKEN = HEAD + '<propfind xmlns="DAV:"><prop><sync-token/></prop></propfind>'
RIGHTS = HEAD + '<propfind xmlns="DAV:"><prop><acl/><current-user-privilege-set/></prop></propfind>'
LOCK = (HEAD + '<lockinfo xmlns="DAV:"><lockscope><exclusive/></lockscope><locktype><write/></locktype><owner>load</owner>'
        '</lockinfo>')
# The requests of each pass in their order, as the store's log has them; checked against real daemons.
EDIT = ["OPTIONS", "LOCK", "PUT", "UNLOCK", "PUT", "HEAD"]
LOOK = ["OPTIONS", "REPORT", "PROPFIND", "PUT", "HEAD"]
READING = ["OPTIONS", "REPORT", "GET", "PROPFIND", "GET", "PUT", "HEAD"]


class Connection:
    """One kept connection of one user's."""

    def __init__(self, world, user):
        self.world = world
        self.login = base64.b64encode(f"{user}:{PASSWORD}".encode()).decode()

    async def __aenter__(self):
        self.reader, self.writer = await asyncio.open_connection("localhost", self.world.store.port, ssl=self.world.tls,
                                                                 server_hostname="localhost")
        return self

    async def __aexit__(self, *_):
        self.writer.close()

    async def send(self, method, path, body="", headers=()):
        text = (f"{method} {path} HTTP/1.1\r\nHost: localhost\r\nAuthorization: Basic {self.login}\r\n"
                + "".join(f"{name}: {value}\r\n" for name, value in headers)
                + (f"Content-Length: {len(body)}\r\n" if body or method == "PUT" else "") + "\r\n" + body)
        self.writer.write(text.encode())
        head = (await self.reader.readuntil(b"\r\n\r\n")).decode("latin-1")
        status = int(head.split(None, 2)[1])
        fields = {name.lower(): value for name, value in
                  (line.split(": ", 1) for line in head.split("\r\n")[1:] if ": " in line)}
        return status, fields

    async def ask(self, *request, **more):
        status, fields = await self.send(*request, **more)
        body = b""
        if request[0] != "HEAD" and status != 204:
            if fields.get("transfer-encoding") == "chunked":
                while size := int(await self.reader.readline(), 16):
                    body += await self.reader.readexactly(size)
                    await self.reader.readline()
                await self.reader.readline()
            else:
                body = await self.reader.readexactly(int(fields.get("content-length", 0)))
        self.world.requests += 1
        if status >= 300:
            self.world.refused.append(f"{request[0]} {request[1]}: {status}")
        return status, fields, body.decode("utf-8", "replace")


class Load:
    """The people, their trees on the store, and what is measured."""

    def __init__(self, store, template, count):
        self.store, self.count = store, count
        self.tls = ssl.create_default_context(cafile=store.authority)
        self.tls.set_alpn_protocols(["http/1.1"])
        self.random = random.Random(17)
        self.tokens = {}  # (reader, publisher) -> token
        self.readers = {i: [] for i in range(count)}
        for i in range(count):
            for _ in range(min(READ, count - 1)):
                self.readers[(i + self.random.randrange(1, count)) % count].append(i)
        self.requests, self.refused, self.taken = 0, [], {"edit": [], "look": [], "reading": []}
        self.contacts = template
        self.held = []
        self.turns = [asyncio.Lock() for _ in range(count)]  # a daemon makes one pass at a time

    def base(self, user):
        return f"/dav/u{user}/Contacts/"

    async def touch_clock(self, connection, user):
        await connection.ask("PUT", self.base(user) + "dateFile", body="clock")
        await connection.ask("HEAD", self.base(user) + "dateFile")

    async def changes(self, connection, reader, publisher):
        token = self.tokens.get((reader, publisher))
        if token is None:
            _, _, body = await connection.ask("PROPFIND", self.base(publisher), body=TOKEN,
                                              headers=[("Depth", "0"), ("Content-Type", XML)])
        else:
            question = (HEAD + f'<sync-collection xmlns="DAV:"><sync-token>{token}</sync-token><sync-level>infinite'
                        '</sync-level><prop><resourcetype/><getlastmodified/><getcontentlength/><getetag/></prop>'
                        '</sync-collection>')
            _, _, body = await connection.ask("REPORT", self.base(publisher), body=question,
                                              headers=[("Depth", "0"), ("Content-Type", XML)])
        if "sync-token>" in body:
            self.tokens[reader, publisher] = body.rsplit("sync-token>", 2)[1].split("<", 1)[0]

    async def edit(self, user):
        contact = self.base(user) + self.random.choice(self.contacts)
        async with Connection(self, f"u{user}") as connection:
            await connection.ask("OPTIONS", self.base(user))
            lock = (await connection.ask("LOCK", self.base(user) + "dateFile", body=LOCK, headers=[
                ("Timeout", "Second-300"), ("Depth", "0"), ("Content-Type", XML)]))[1].get("lock-token", "")
            text = f"<plist version=\"1.0\"><dict><key>note</key><string>{'x' * 1700}{self.requests}</string></dict></plist>"
            await connection.ask("PUT", contact, body=text)
            await connection.ask("UNLOCK", self.base(user) + "dateFile", headers=[("Lock-Token", lock)])
            await self.touch_clock(connection, user)
        return contact

    async def look(self, reader, publisher, contact=None):
        async with Connection(self, f"u{reader}") as connection:
            await connection.ask("OPTIONS", self.base(reader))
            await self.changes(connection, reader, publisher)
            if contact:
                await connection.ask("GET", self.base(publisher) + "info")
            await connection.ask("PROPFIND", self.base(publisher) + "AllCXGroup", body=RIGHTS,
                                 headers=[("Depth", "0"), ("Content-Type", XML)])
            if contact:
                await connection.ask("GET", contact)
            await self.touch_clock(connection, reader)

    async def timed(self, kind, user, work):
        async with self.turns[user]:
            began = time.monotonic()
            try:
                return await asyncio.wait_for(work, 60)
            except (OSError, asyncio.TimeoutError, asyncio.IncompleteReadError) as error:
                self.refused.append(f"{kind}: {error!r}")
            finally:
                self.taken[kind].append(time.monotonic() - began)

    async def an_edit_and_its_readers(self, user):
        contact = await self.timed("edit", user, self.edit(user))
        if not contact:
            return

        async def read(reader):
            await asyncio.sleep(self.random.uniform(0, 0.1))
            await self.timed("reading", reader, self.look(reader, user, contact))
        await asyncio.gather(*(read(reader) for reader in self.readers[user]))

    async def wait_for_news(self):
        """One held request for each, as daemons hold one for all their trees."""
        async def hold(user):
            connection = Connection(self, f"u{user}")
            await connection.__aenter__()
            body = ('<R:news xmlns:R="http://rolvane.net/ns/" xmlns:D="DAV:"><D:href>' + self.base(user) +
                    "</D:href></R:news>")
            status, _ = await connection.send("REPORT", "/dav/", body=body, headers=[("Content-Type", "text/xml")])
            if status != 200:
                self.refused.append(f"news: {status}")
            self.held.append(connection)
        for begin in range(0, self.count, 20):
            await asyncio.gather(*(hold(user) for user in range(begin, min(begin + 20, self.count))))

    async def play(self, pace, seconds):
        """Edits and looks at random moments, at that pace."""
        for kind in self.taken:
            self.taken[kind] = []
        self.requests, self.refused = 0, []
        server, own, busy, began = self.store.process.cpu(), time.process_time(), busy_seconds(), time.monotonic()
        rate = pace * self.count * (EDITS_AN_HOUR + LOOKS_AN_HOUR) / 3600
        tasks = []
        while time.monotonic() - began < seconds:
            await asyncio.sleep(self.random.expovariate(rate))
            user = self.random.randrange(self.count)
            if self.random.random() < EDITS_AN_HOUR / (EDITS_AN_HOUR + LOOKS_AN_HOUR):
                tasks.append(asyncio.create_task(self.an_edit_and_its_readers(user)))
            else:
                tasks.append(asyncio.create_task(self.timed("look", user, self.look(user, (user + 1) % self.count))))
        await asyncio.gather(*tasks)
        wall = time.monotonic() - began
        all_passes = sorted(sum(self.taken.values(), []))
        passes = len(all_passes)
        if not passes:
            return None
        return {"pace": pace, "passes": passes / wall, "requests": self.requests / wall,
                "cpu": (self.store.process.cpu() - server) / wall,
                "own cpu": (time.process_time() - own) / wall, "busy": (busy_seconds() - busy) / wall,
                "ms a pass": 1000 * (self.store.process.cpu() - server) / passes,
                "refused": len(self.refused), "half": 1000 * statistics.median(all_passes), "of 100": 1000 * all_passes[int(0.99 * (passes - 1))],
                "longest": 1000 * all_passes[-1], "megabytes": megabytes(self.store)}


def check_real_passes(alice, bob, store):
    """Two daemons make the passes that are played."""
    def methods(user, action, expected, what):
        log = store.log_size()
        action()
        end = time.monotonic() + 30
        while time.monotonic() < end:
            seen = [method for method, _, _ in store.requests(log, user)]
            if sorted(seen) == sorted(expected):
                return
            time.sleep(0.1)
        raise Failure(f"{what} of a daemon makes other requests: {seen}, and not {expected}")

    name = "Fräulein Numéro 7"
    methods("alice", lambda: alice.run("edit", name, "--note", "one"), EDIT, "an edit")
    methods("bob", lambda: bob.run("sync"), READING, "a reading")
    bob.run("sync")
    bob.run("sync")
    methods("bob", lambda: bob.run("sync"), LOOK, "a look")


def populate(store, alice, count):
    """So many users with the password of the bench, each with alice's tree and with everybody as readers."""
    root = os.path.dirname(os.path.dirname(store.log))
    store.add_user("u0")
    passwords = os.path.join(root, "conf", "passwords")
    with open(passwords) as file:
        lines = file.read().splitlines()
    digest = next(line.split(":", 1)[1] for line in lines if line.startswith("u0:"))
    with open(passwords, "w") as file:
        file.write("\n".join(lines + [f"u{i}:{digest}" for i in range(1, count)]) + "\n")
    tree = store.tree("alice").rstrip("/")
    owner = os.stat(tree)  # run by root, the store's files are of httpd's user
    for i in range(count):
        place = store.tree(f"u{i}").rstrip("/")
        shutil.rmtree(place, ignore_errors=True)
        os.makedirs(os.path.dirname(place), exist_ok=True)
        shutil.copytree(tree, place, copy_function=os.link)
        for directory, _, _ in [(os.path.dirname(place), 0, 0), *os.walk(place)]:
            os.chown(directory, owner.st_uid, owner.st_gid)
        with open(os.path.join(root, "lists", f"u{i}.acl"), "w") as out:
            out.write("davacl 1\n/Contacts r authenticated\nend\n")
    return [path for path, _, _ in store.files("alice")]


async def run(load, seconds):
    await load.wait_for_news()
    for begin in range(0, load.count, 20):  # everybody knows the trees they read, as after a first pass
        await asyncio.gather(*(load.look(reader, user) for user in range(begin, min(begin + 20, load.count))
                               for reader in load.readers[user]))
    rows, pace = [], 1
    while True:
        row = await load.play(pace, seconds)
        if row:
            rows.append(row)
            print(f"  {pace:>4} x | {row['passes']:6.1f} passes/s {row['requests']:7.1f} requests/s | httpd {row['cpu']:.3f} CPUs, "
                  f"{row['ms a pass']:.1f} ms a pass | pass: half {row['half']:.0f} ms, 99 of 100 {row['of 100']:.0f} ms, longest "
                  f"{row['longest']:.0f} ms | {row['megabytes']:.0f} MB | {row['refused']} refused | generator {row['own cpu']:.2f} CPUs, machine "
                  f"{row['busy']:.2f}", flush=True)
            if row["cpu"] > MOST_OF_MACHINE * os.cpu_count() or row["of 100"] > 1000 * MOST_SECONDS or row["refused"]:
                break
        if pace >= 640:
            break
        pace = 10 if pace == 1 else 2 * pace
    for connection in load.held:
        connection.writer.close()
    return rows


def main(build, count=1000, seconds=20):
    with World() as world:
        keeper = Person("keeper", build, world.root)
        world.at_end(keeper.leave)
        store = Store(keeper)
        world.at_end(lambda: keeper.run("store", "stop", "--now"))
        alice = Publisher("alice", build, world.root, store, CONTACTS, 3)
        world.at_end(alice.leave)
        store.add_user("bob")
        bob = Person("bob", build, world.root)
        world.at_end(bob.leave)
        bob.run("account", "set", "--user", "bob", "--endpoint", store.endpoint, "--ca-file", store.authority,
                "--ask-password", stdin=PASSWORD + "\n")
        alice.run("publish", "--quiet")
        alice.run("share", "bob")
        bob.run("subscribe", "alice")
        for person in (alice, bob):
            person.run("daemon", "start")
            person.run("sync")
        check_real_passes(alice, bob, store)
        contacts = populate(store, alice, count)
        before = megabytes(store)
        load = Load(store, contacts, count)
        rows = asyncio.run(run(load, seconds))
        print(f"{count} people; httpd had {before:.0f} MB before them", flush=True)
        save_json(os.path.join(build, "load.json"), rows)
        put_table("load", [
            f"{count:,} people on one httpd; the machine has {os.cpu_count()} processors, and the generator runs on it, too.", "",
            "| pace | passes a second | requests a second | httpd: CPUs | CPU a pass | half of the passes | 99 of 100 | longest | refused | memory | machine: CPUs |",
            "|---|---|---|---|---|---|---|---|---|---|---|"] + [
            f"| {row['pace']} x | {row['passes']:.1f} | {row['requests']:.0f} | {row['cpu']:.2f} | {row['ms a pass']:.1f} ms | "
            f"{row['half']:.0f} ms | {row['of 100']:.0f} ms | {row['longest']:.0f} ms | {row['refused']} | {row['megabytes']:.0f} MB | {row['busy']:.2f} |" for row in rows])
        if load.refused:
            print(f"  refused at the last pace: {load.refused[:3]}")
        return 0 if rows and not rows[0]["refused"] and rows[0]["cpu"] <= MOST_OF_MACHINE * os.cpu_count() else 1


if __name__ == "__main__":
    try:
        sys.exit(main(sys.argv[1], *map(int, sys.argv[2:])))
    except Failure as failure:
        raise SystemExit(f"load: {failure}") from None
