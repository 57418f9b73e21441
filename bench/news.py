#!/usr/bin/env python3
"""usage: news.py BUILD [EDITS] [WAITING]

How long an edit takes from `rolvane edit` to the other person's database when nobody says `sync`; and what so many
requests that wait for news cost one httpd: memory, and how soon after a change the last of them has its line.
Exit code 1 when the median of the edits is over a second, or the memory over 100 MB."""

import base64
import http.client
import os
import select
import socket
import sqlite3
import ssl
import statistics
import sys
import time

from benchworld import PASSWORD, Failure, Person, Publisher, Store, World, put_table, save_json

PEOPLE, MOST_SECONDS, MOST_MEGABYTES = 100, 1.0, 100
OF_ONE_USER = 16  # requests that the store lets one user have
BODY = ('<R:news xmlns:R="http://rolvane.net/ns/" xmlns:D="DAV:"><D:href>/dav/alice/Contacts/</D:href></R:news>')
EVERYBODY = ('<D:acl xmlns:D="DAV:"><D:ace><D:principal><D:authenticated/></D:principal><D:grant><D:privilege><D:read/>'
             '</D:privilege></D:grant></D:ace></D:acl>')


def arrival(database, note):
    """When the database has the text, asked every two milliseconds."""
    opened = sqlite3.connect(f"file:{database}?mode=ro", uri=True)
    end = time.monotonic() + 60
    while time.monotonic() < end:
        if opened.execute("select 1 from records where instr(properties, ?) limit 1", (note.encode(),)).fetchone():
            return time.monotonic()
        time.sleep(0.002)
    raise Failure(f"{note!r} has not come within a minute")


def edits(alice, bob, count):
    """Seconds from the end of `rolvane edit` and from its beginning to bob's database."""
    database = os.path.join(bob.home, "data/rolvane/contacts.db")
    ended, begun = [], []
    for i in range(count):
        note = f"news number {i:05}."
        start = time.monotonic()
        alice.run("edit", f"Fräulein Numéro {i % PEOPLE}", "--note", note)
        done = time.monotonic()
        there = arrival(database, note)
        ended.append(there - done)
        begun.append(there - start)
        time.sleep(0.5)  # one edit at a time, as people make them
    return ended, begun


def login(user):
    return "Basic " + base64.b64encode(f"{user}:{PASSWORD}".encode()).decode()


def trusting(store):
    context = ssl.create_default_context(cafile=store.authority)
    context.set_alpn_protocols(["http/1.1"])
    return context


def asked(store, user, method, path, body):
    connection = http.client.HTTPSConnection("localhost", store.port, context=trusting(store))
    connection.request(method, path, body, {"Authorization": login(user), "Content-Type": "text/xml"})
    status = connection.getresponse().status
    if status >= 300:
        raise Failure(f"{method} {path}: {status}")
    connection.close()


def line_of(connection):
    """Whatever has come, within five seconds."""
    try:
        return connection.recv(4096)
    except TimeoutError:
        return b""


def waiting(store, count):
    context, connections = trusting(store), []
    for i in range(count):
        raw = socket.create_connection(("localhost", store.port))
        raw.settimeout(5)
        connection = context.wrap_socket(raw, server_hostname="localhost")
        connection.sendall((f"REPORT /dav/ HTTP/1.1\r\nHost: localhost\r\nAuthorization: {login(f'w{i // OF_ONE_USER}')}\r\n"
                            f"Content-Type: text/xml\r\nContent-Length: {len(BODY)}\r\n\r\n{BODY}").encode())
        connections.append(connection)
    for i, connection in enumerate(connections):
        text = b""
        while b"begin" not in text:
            if not (more := line_of(connection)):
                raise Failure(f"request {i} does not wait: {text[:200]!r}")
            text += more
    return connections


def megabytes(store):
    """Of all processes of httpd, what several share counted once."""
    total = 0
    for number in store.process._family():
        with open(f"/proc/{number}/smaps_rollup") as lines:
            total += sum(int(line.split()[1]) for line in lines if line.startswith("Pss:"))
    return total / 1024


def lines_after_a_change(store, connections):
    """Milliseconds from the answer to a PUT until the first, the middle and the last have a line."""
    asked(store, "alice", "PUT", "/dav/alice/Contacts/bench", "one more")
    began, left, times = time.monotonic(), {c.fileno(): c for c in connections}, []
    poll = select.poll()
    for number in left:
        poll.register(number, select.POLLIN)
    while left:
        ready = poll.poll(20000)
        if not ready:
            raise Failure(f"{len(left)} of {len(connections)} have no line")
        for number, _ in ready:
            if b"news 1" in line_of(left[number]):
                times.append(1000 * (time.monotonic() - began))
                poll.unregister(left.pop(number).fileno())
    return times[0], statistics.median(times), times[-1]


def main(build, count=40, held=1000):
    with World() as world:
        keeper = Person("keeper", build, world.root)
        world.at_end(keeper.leave)
        store = Store(keeper)
        world.at_end(lambda: keeper.run("store", "stop"))
        alice = Publisher("alice", build, world.root, store, PEOPLE, 3)
        world.at_end(alice.leave)
        store.add_user("bob")
        bob = Person("bob", build, world.root)
        world.at_end(bob.leave)
        for person in (alice, bob):
            person.environment.pop("ROLVANE_NEWS", None)
        bob.run("account", "set", "--user", "bob", "--endpoint", store.endpoint, "--ca-file", store.authority,
                "--ask-password", stdin=PASSWORD + "\n")
        alice.run("publish", "--quiet")
        alice.run("share", "bob")
        bob.run("subscribe", "alice")
        log = store.log_size()
        ended, begun = edits(alice, bob, count)
        requests = len(store.requests(log, "bob"))
        print(f"edit to the other person's database, {count} edits: median {1000 * statistics.median(ended):.0f} ms from the "
              f"end of the command, {1000 * statistics.median(begun):.0f} ms from its beginning; longest "
              f"{1000 * max(ended):.0f} ms; the reader made {requests / count:.1f} requests an edit")

        for i in range((held + OF_ONE_USER - 1) // OF_ONE_USER):
            keeper.run("store", "user", "add", f"w{i}", stdin=PASSWORD + "\n")
        asked(store, "alice", "ACL", "/dav/alice/Contacts/", EVERYBODY)
        before = megabytes(store)
        connections = waiting(store, held)
        memory = megabytes(store) - before
        cpu, rest = store.process.cpu(), time.monotonic()
        time.sleep(20)
        idle = (store.process.cpu() - cpu) / (time.monotonic() - rest)
        rounds = []
        for _ in range(5):
            time.sleep(1)
            rounds.append(lines_after_a_change(store, connections))
        first, middle, last = (statistics.median(each) for each in zip(*rounds))
        print(f"{held} requests that wait: {memory:.0f} MB more ({before + memory:.0f} MB together), {1000 * idle:.1f} ms of "
              f"CPU a second at rest; after a change the first has its line within {first:.0f} ms, half of them within "
              f"{middle:.0f} ms, the last within {last:.0f} ms")
        for connection in connections:
            connection.close()
        save_json(os.path.join(build, "news.json"),
                  {"delays": ended, "since_begun": begun, "requests": requests / count, "waiting": held, "megabytes": memory,
                   "idle": idle, "lines": [first, middle, last]})
        put_table("news", [
            "| what | seen | aim |", "|---|---|---|",
            f"| an edit in the other person's database, from the end of `rolvane edit`: median of {count} | "
            f"{1000 * statistics.median(ended):.0f} ms | 1,000 ms |",
            f"| the slowest of them | {1000 * max(ended):.0f} ms | |",
            f"| requests of the reader for an edit | {requests / count:.1f} | |",
            f"| memory of httpd for {held} requests that wait | {memory:.0f} MB | 100 MB |",
            f"| CPU for them at rest | {1000 * idle:.1f} ms a second | |",
            f"| after a change the first, the middle, the last has its line | {first:.0f}, {middle:.0f}, {last:.0f} ms | |"])
        return 0 if statistics.median(ended) <= MOST_SECONDS and memory <= MOST_MEGABYTES else 1


if __name__ == "__main__":
    sys.exit(main(sys.argv[1], *map(int, sys.argv[2:])))
