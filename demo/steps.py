"""The parts of a demonstration, with their times, and the checks that it makes."""

import time

from storeview import normal
from world import Failure, wait_until

PASSWORD = "a long and private word"

summary = []


def say(text):
    print(f"  {text}", flush=True)


class Step:
    """One part of the demonstration, with its time; a failure ends the whole."""

    def __init__(self, title):
        self.title = title

    def __enter__(self):
        print(f"\n== {self.title}", flush=True)
        self.began = time.monotonic()
        return self

    def __exit__(self, kind, error, _):
        took = time.monotonic() - self.began
        summary.append((self.title, took, "ok" if kind is None else "FAILED"))
        return False


def check(agreed, text):
    if not agreed:
        raise Failure(text)
    say(f"✓ {text}")


def timed(title, seconds, test):
    """Waits until the test holds; says and notes how long it took."""
    began = time.monotonic()
    wait_until(test, seconds, title)
    delay = time.monotonic() - began
    summary.append((f"  {title}", delay, "ok"))
    return delay


def sign_up(person, store_owner, endpoint, authority):
    store_owner.run("store", "user", "add", person.name, stdin=PASSWORD + "\n")
    person.run("account", "set", "--user", person.name, "--endpoint", endpoint, "--ca-file", authority,
               "--ask-password", stdin=PASSWORD + "\n")


def records(person, *whose):
    """(people, groups) of a database, as the application prints them, by their identifiers on a store."""
    people, groups = person.json("list", "--full", *whose), person.json("group", "list", *whose)
    return {normal(p["identifier"]): p for p in people}, {normal(g["identifier"]): g for g in groups}


def copy_differences(owner, subscriber):
    """Where the subscriber's copies are not what the owner has; a list of sentences, empty when all is equal."""
    (people, groups), (their_people, their_groups) = records(owner, "--own"), records(subscriber, "--of", owner.name)
    found = []
    for uid in sorted(their_people.keys() - people.keys()):
        found.append(f"the subscriber has {their_people[uid]['name']} ({uid}), whom the owner has not")
    for uid in sorted(their_groups.keys() - groups.keys()):
        found.append(f"the subscriber has the group {their_groups[uid]['name']} ({uid}), which the owner has not")
    for uid, person in people.items():
        if uid not in their_people:
            found.append(f"the subscriber misses {person['name']} ({uid})")
            continue
        mine, theirs = person["properties"], dict(their_people[uid]["properties"])
        stamp = theirs.pop("RemoteLocation", None)
        if not stamp or stamp["labels"] != ["Subscribe"] or stamp["values"] != [their_people[uid]["location"]]:
            found.append(f"the copy of {person['name']} does not say where it came from: {stamp}")
        keys = [key for key in sorted({*mine, *theirs}) if mine.get(key) != theirs.get(key)]
        if keys:
            found.append(f"the copy of {person['name']} ({uid}) differs in {', '.join(keys)}")
        if sorted(person["groups"]) != sorted(their_people[uid]["groups"]):
            found.append(f"{person['name']} is in {person['groups']}, the copy in {their_people[uid]['groups']}")
    for uid, group in groups.items():
        if uid not in their_groups:
            found.append(f"the subscriber misses the group {group['name']} ({uid})")
            continue
        copy = their_groups[uid]
        if copy["name"] != group["name"]:
            found.append(f"the copy of the group {group['name']} is called {copy['name']}")
        for key in ("members", "subgroups"):
            mine, theirs = (sorted(normal(u) for u in g[key]) for g in (group, copy))
            if mine != theirs:
                found.append(f"the copy of the group {group['name']} differs in its {key}: "
                             f"{len(set(mine) - set(theirs))} missing, {len(set(theirs) - set(mine))} too many")
        mine, theirs = ({normal(u): c for u, c in g["distribution"].items()} for g in (group, copy))
        if mine != theirs:
            found.append(f"the copy of the group {group['name']} differs in its choices of values")
    return found


def check_copies(owner, subscriber, what):
    found = copy_differences(owner, subscriber)
    for difference in found[:20]:
        say(f"✗ {difference}")
    if found:
        raise Failure(f"{what}: the two databases differ in {len(found)} places")
    people, groups = records(owner, "--own")
    say(f"✓ {what}: {subscriber.name} has {owner.name}'s {len(people)} people and {len(groups)} groups, "
        f"compared field by field")
