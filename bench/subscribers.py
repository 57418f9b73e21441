#!/usr/bin/env python3
"""usage: subscribers.py BUILD [NUMBER]

So many people (200), each with a home and a daemon of their own, subscribe to one publisher at the same moment, on one store. All of
them have to get everything. Prints how long they took, and what httpd and the whole machine did for it."""

import os
import sys
import time

from benchworld import PASSWORD, Failure, Person, Publisher, Store, World, busy_seconds

PEOPLE = 2       # whom the publisher shares
PATIENCE = 200   # seconds for one subscription


def make_reader(number, build, root, store):
    reader = Person(f"reader{number}", build, root)
    store.add_user(reader.name)
    reader.run("account", "set", "--user", reader.name, "--endpoint", store.endpoint, "--ca-file", store.authority,
               "--ask-password", stdin=PASSWORD + "\n")
    return reader


def main(build, number):
    with World() as world:
        keeper = Person("keeper", build, world.root)
        world.at_end(keeper.leave)
        world.at_end(lambda: keeper.run("store", "stop", "--now"))
        store = Store(keeper)
        alice = Publisher("alice", build, world.root, store, PEOPLE, 4)
        world.at_end(alice.leave)
        alice.run("publish", "--quiet")
        readers = []
        for i in range(number):
            readers.append(make_reader(i, build, world.root, store))
            world.at_end(readers[-1].leave)
        # One list for all of them: two hundred commands of the publisher's are not measured here.
        lists = os.path.join(os.path.dirname(os.path.dirname(store.log)), "lists", "alice.acl")
        with open(lists, "w") as out:
            out.write("davacl 1\n" + "".join(f"/Contacts r user {r.name}\n" for r in readers) + "end\n")
        server, busy, began = store.process.cpu(), busy_seconds(), time.monotonic()
        started = [(reader, reader.start("subscribe", "alice", stdout=-1, stderr=-1)) for reader in readers]
        failed, times = [], []
        for reader, command in started:
            said = command.communicate(timeout=PATIENCE)[1]
            times.append(time.monotonic() - began)
            if command.returncode != 0:
                failed.append(f"{reader.name} ended with {command.returncode}: {said.strip()}")
        server, busy = store.process.cpu() - server, busy_seconds() - busy
        for reader in readers:
            found = len(reader.json("list"))
            if found != PEOPLE:
                failed.append(f"{reader.name} has {found} of {PEOPLE} people")
        print(f"{number} subscriptions at once: all through after {max(times):.1f} s; CPU {server:.1f} s of httpd, "
              f"{busy:.1f} s of the machine; {len(failed)} failed", flush=True)
        if failed:
            raise Failure("\n".join(failed[:10]))


if __name__ == "__main__":
    try:
        main(sys.argv[1], int(sys.argv[2]) if len(sys.argv) > 2 else 200)
    except Failure as failure:
        raise SystemExit(f"subscribers: {failure}") from None
