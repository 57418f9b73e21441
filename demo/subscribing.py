"""The two-sided part: an owner and a subscriber, each with a home, a session bus and a daemon of their own."""

import os
import plistlib
import re
import subprocess
import time

from steps import Step, check, check_copies, records, say, sign_up, summary
from storeview import normal
from world import Failure, Person, wait_until

PASS_SECONDS = 60


def talk(person, *arguments, may=(0,)):
    """Runs the contact application and shows what it says; gives (exit code, what it said)."""
    done = subprocess.run([person.program, *arguments], env=person.environment, text=True, capture_output=True,
                          timeout=600, stdin=subprocess.DEVNULL)
    lines = [line for line in done.stderr.splitlines() if not re.match(r"\w+ \d+%", line)]
    for line in lines:
        say(f"{person.name}: {line}")
    if done.returncode not in may:
        raise Failure(f"`rolvane {' '.join(arguments)}` of {person.name} ended with {done.returncode}: {done.stderr}")
    return done.returncode, "\n".join(lines)


def carried(title, source, target, change, arrived):
    """A change of the source's, a pass of the target's, and the target has it. The time is that of the target's pass."""
    result = change()
    wait_until(lambda: (source.json("status")["pending"] == 0, "changes wait"), PASS_SECONDS, f"{title}, sent")
    # An edit goes out a moment after the command has returned, and what is not yet in the queue is not waiting there.
    began, passes = time.monotonic(), 0
    while True:
        started = time.monotonic()
        target.run("sync")
        took, passes = time.monotonic() - started, passes + 1
        if arrived(result):
            break
        if time.monotonic() - began > PASS_SECONDS:
            raise Failure(f"{title}: {target.name} does not have it after {passes} passes")
    say(f"✓ {title}: {target.name} has it after {took:.2f} s of a pass ({passes} in all)")
    summary.append((f"  {title}", took, "ok"))
    return result


def owner_edits(owner, subscriber):
    """Edits, adds, deletes, renames and regroups; each arrives in a pass of the subscriber's."""
    people, groups = (list(part.values()) for part in records(owner, "--own"))
    edited, victim = people[5], people[11]
    first, second = groups[0], groups[1]
    mover = next(uid for uid in first["members"] if uid not in second["members"]
                 and normal(uid) not in (normal(victim["identifier"]), normal(edited["identifier"])))

    def theirs():
        return records(subscriber, "--of", owner.name)

    def group_of(uid):
        return theirs()[1].get(normal(uid), {"members": [], "name": None})

    carried("an edited person", owner, subscriber,
            lambda: owner.run("edit", edited["identifier"], "--nickname", "Changed, ü 字", "--phone", "work:+1 555 0177"),
            lambda _: theirs()[0][normal(edited["identifier"])]["properties"].get("Nickname") == "Changed, ü 字")
    carried("an added person, member of a group", owner, subscriber,
            lambda: owner.run("add", "--first", "Nova", "--last", "Second", "--group", first["identifier"]).strip(),
            lambda uid: normal(uid) in theirs()[0] and
            normal(uid) in [normal(m) for m in group_of(first["identifier"])["members"]])
    carried("a deleted person", owner, subscriber,
            lambda: owner.run("delete", victim["identifier"], "--yes"),
            lambda _: normal(victim["identifier"]) not in theirs()[0])
    carried("a renamed group", owner, subscriber,
            lambda: owner.run("group", "rename", second["identifier"], "Renamed for two – 名前"),
            lambda _: group_of(second["identifier"])["name"] == "Renamed for two – 名前")

    def move():
        owner.run("group", "remove", first["identifier"], mover)
        owner.run("group", "add", second["identifier"], mover)

    def moved(_):
        there = [normal(m) for m in group_of(second["identifier"])["members"]]
        left = [normal(m) for m in group_of(first["identifier"])["members"]]
        return normal(mover) in there and normal(mover) not in left

    carried("a member moved to another group", owner, subscriber, move, moved)
    carried("a new group", owner, subscriber,
            lambda: owner.run("group", "create", "New for two", edited["identifier"]).strip().splitlines()[0],
            lambda uid: len(group_of(uid)["members"]) == 1)


def refused_edit(owner, subscriber):
    copy = subscriber.json("list", "--of", owner.name)[3]
    code, said = talk(subscriber, "edit", copy["identifier"], "--note", "not mine", may=(5,))
    check("read but not changed" in said, f"{subscriber.name} may not edit {copy['name']}: exit code {code}")


def withdrawal(owner, subscriber):
    count = len(subscriber.json("list", "--of", owner.name))
    talk(owner, "unpublish")
    began = time.monotonic()
    subscriber.run("sync")
    gone = time.monotonic() - began
    summary.append(("  the copies leave", gone, "ok"))
    left = [p for p in subscriber.json("list") if p["owner"]]
    check(not left and subscriber.json("subscriptions") == [],
          f"the {count} copies have left, and the subscription with them, in a pass of {gone:.2f} s")
    return count


def open_tree(store_owner, owner, readers):
    """Lets others read a tree on a store that keeps no access lists: its administrator's configuration says so."""
    path = os.path.join(store_owner.environment["XDG_STATE_HOME"], "rolvane/store/store.plist")
    store_owner.run("store", "stop")
    with open(path, "rb") as file:
        options = plistlib.load(file)
    root = os.path.join(os.path.dirname(path), "root/dav", owner.name)
    options["accessLists"] = False
    options["extraConfiguration"] = [
        f'<Directory "{root}">', "<RequireAny>", f"Require user {owner.name}", "<RequireAll>",
        f"Require user {' '.join(reader.name for reader in readers)}",
        "Require method GET HEAD OPTIONS PROPFIND REPORT", "</RequireAll>", "</RequireAny>", "</Directory>"]
    with open(path, "wb") as file:
        plistlib.dump(options, file)
    store_owner.run("store", "start")


def subscription(world, owner, endpoint, authority):
    subscriber = Person("cleo", owner.build, world.root)
    world.at_end(subscriber.leave)
    sign_up(subscriber, owner, endpoint, authority)
    with Step("A stranger's subscription is refused"):
        code, said = talk(subscriber, "subscribe", owner.name, may=(5,))
        check("does not let you read" in said, f"exit code {code}")
    open_tree(owner, owner, [subscriber])
    with Step("Subscribe to the contacts of another user"):
        began = time.monotonic()
        talk(subscriber, "subscribe", owner.name)
        say(f"✓ `rolvane subscribe` returned after {time.monotonic() - began:.2f} s")
        check_copies(owner, subscriber, "first pass")
        refused_edit(owner, subscriber)
    with Step("The owner edits, adds, deletes, renames and regroups"):
        owner_edits(owner, subscriber)
        check_copies(owner, subscriber, "after the owner's edits")
    with Step("The owner withdraws"):
        withdrawal(owner, subscriber)
