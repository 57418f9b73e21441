#!/usr/bin/env python3
"""usage: onechange.py BUILD [PEOPLE...]

What one edit, ten edits and a pass with nothing new cost, among 1,000, 10,000 and 100,000 people: CPU of the daemon,
bytes that it hands to the kernel to be written to files, requests and the bytes of their answers, for whoever publishes
and for a subscriber. Exit code 1 when one of the limits below is exceeded. BUILD/onechange.json has the figures."""

import os
import statistics
import sys
import time

from benchworld import Failure, Person, Publisher, Store, World, put_table, save_json
from firstpass import entries

SIZES = [1000, 10000, 100000]
EDITS = 7
# of one edit, of a pass with nothing new, and of ten edits for the reader
LIMITS = {"edit": {"ms": 10, "written": 64000, "requests": 6},
          "nothing": {"ms": 10, "read": 5000, "requests": 5},
          "ten": {"read": 40000, "requests": 20}}


def cpu_ms(number):
    """Of all threads, those that have ended included."""
    return 1000 * time.clock_gettime((~number << 3) | 2)


def written(number):
    with open(f"/proc/{number}/io") as lines:
        return int(next(line for line in lines if line.startswith("wchar")).split()[1])


class Watched:
    """A daemon and its requests."""

    def __init__(self, person, store):
        self.person, self.store = person, store

    def settled(self):
        """When the daemon has done nothing for a while: what follows the end of a pass belongs to it."""
        number = self.person.daemon()
        if number is None:
            raise Failure(f"{self.person.name}'s daemon is not running")
        before, since = cpu_ms(number), time.monotonic()
        while time.monotonic() - since < 0.3:
            time.sleep(0.02)
            if (now := cpu_ms(number)) != before:
                before, since = now, time.monotonic()
        return number, before

    def cost(self, action):
        number, cpu = self.settled()
        files, log = written(number), self.store.log_size()
        action()
        after, now = self.settled()
        if after != number:  # another process: all that it has done
            cpu = files = 0
        requests = entries(self.store, log, self.person.name)
        return {"ms": now - cpu, "written": written(after) - files, "requests": len(requests),
                "read": sum(r.bytes for r in requests), "list": [f"{r.method} {r.status} {r.bytes} {r.path}" for r in requests]}


def middle(costs):
    return {key: statistics.median(cost[key] for cost in costs) for key in ("ms", "written", "requests", "read")} | {
        "list": costs[-1]["list"]}


def edits_of(publisher, chosen, word):
    for i, name in enumerate(chosen):
        publisher.run("edit", name, "--nickname", f"{word} {i}")


def measure(publisher, subscriber, store, count):
    """The costs by name; both have made their first pass."""
    alice, bob = Watched(publisher, store), Watched(subscriber, store)
    for person in (publisher, subscriber):
        person.run("daemon", "start")
    names = [f"Fräulein Numéro {(7 + 11 * i) % count}" for i in range(30)]
    publisher.run("sync")
    subscriber.run("sync")
    found = {}
    edits, readings = [], []
    for name in names[:EDITS]:
        edits.append(alice.cost(lambda name=name: edits_of(publisher, [name], f"{time.monotonic_ns()}")))
        readings.append(bob.cost(lambda: subscriber.run("sync")))
    found["edit"], found["its reader"] = middle(edits), middle(readings)
    found["nothing, publisher"] = middle([alice.cost(lambda: publisher.run("sync")) for _ in range(5)])
    # The first two compare everybody: the database and the states are others than before the reading.
    found["the first pass behind a reading"] = bob.cost(lambda: subscriber.run("sync"))
    found["the second"] = bob.cost(lambda: subscriber.run("sync"))
    found["nothing, reader"] = middle([bob.cost(lambda: subscriber.run("sync")) for _ in range(5)])
    for person, watched, who in ((publisher, alice, "publisher"), (subscriber, bob, "reader")):
        def again(person=person):
            person.run("daemon", "stop")
            person.run("daemon", "start")
            person.run("sync")
        found[f"nothing, {who} that starts"] = middle([watched.cost(again) for _ in range(2)])
    edits_of(publisher, names[10:20], f"{time.monotonic_ns()}")
    alice.settled()
    found["ten, reader"] = middle([bob.cost(lambda: subscriber.run("sync"))])
    return found


def show(count, found):
    over = []
    for what, cost in found.items():
        words = [f"{cost['ms']:8.1f} ms", f"{cost['written'] / 1000:9.1f} kB written", f"{cost['requests']:5.0f} requests",
                 f"{cost['read'] / 1000:8.1f} kB read"]
        limits = LIMITS.get(what.split(",")[0], {})
        exceeded = [key for key, most in limits.items() if cost[key] > most]
        over += [f"{count} people, {what}: {key}" for key in exceeded]
        print(f"  {count:>6} | {what:<30} | {' | '.join(words)}{'   OVER: ' + ', '.join(exceeded) if exceeded else ''}",
              flush=True)
        if os.environ.get("BENCH_LIST"):
            print("".join(f"      {line}\n" for line in cost["list"]), end="", flush=True)
    return over


def make(build, root, store, count):
    """A publisher of so many people and a subscriber, both with their daemons."""
    publisher = Publisher(f"p{count}", build, root, store, count, 10)
    publisher.run("publish", "--quiet", "--timeout", "3000")
    store.add_user(f"s{count}")
    subscriber = Person(f"s{count}", build, root)
    subscriber.run("account", "set", "--user", subscriber.name, "--endpoint", store.endpoint, "--ca-file", store.authority,
                   "--ask-password", stdin="bench-and-nothing-else\n")
    publisher.run("share", subscriber.name)
    subscriber.run("subscribe", publisher.name, "--timeout", "3000")
    return publisher, subscriber


def main(build, *sizes):
    results, over = {}, []
    with World() as world:
        keeper = Person("keeper", build, world.root)
        world.at_end(keeper.leave)
        store = Store(keeper)
        world.at_end(lambda: keeper.run("store", "stop"))
        for count in [int(size) for size in sizes] or SIZES:
            if time.time() > float(os.environ.get("BENCH_UNTIL", "inf")):
                print(f"  left out, as the time is over: {count}", flush=True)
                continue
            publisher, subscriber = make(build, world.root, store, count)
            results[count] = measure(publisher, subscriber, store, count)
            over += show(count, results[count])
            publisher.leave()
            subscriber.leave()
    save_json(os.path.join(build, "onechange.json"), results)
    put_table("onechange", ["| people | what | CPU ms | kB written | requests | kB read |", "|---|---|---|---|---|---|"] + [
        f"| {count:,} | {what} | {cost['ms']:.1f} | {cost['written'] / 1000:.1f} | {cost['requests']:.0f} | "
        f"{cost['read'] / 1000:.1f} |" for count, found in results.items() for what, cost in found.items()])
    for text in over:
        print(f"  OVER    {text}")
    return 1 if over else 0


if __name__ == "__main__":
    sys.exit(main(*sys.argv[1:]))
