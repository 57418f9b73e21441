"""The two-sided part: an owner and a subscriber, each with a home, a session bus and a daemon of their own."""

import os
import re
import subprocess
import time

from books import client_edits
from steps import PASSWORD, Step, check, check_copies, records, say, sign_up, summary
from storeview import StoreView, normal
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


def subscriber_edits(owner, subscriber):
    """Who may write edits the copies; each edit arrives in a pass of the owner's."""
    people, groups = (list(part.values()) for part in records(subscriber, "--of", owner.name))
    edited, victim = people[21], people[33]
    group = next(g for g in groups if len(g["members"]) > 3)
    leaver = next(uid for uid in group["members"] if normal(uid) not in
                  (normal(edited["identifier"]), normal(victim["identifier"])))

    def mine():
        return records(owner, "--own")

    carried("an edit of the subscriber's", subscriber, owner,
            lambda: subscriber.run("edit", edited["identifier"], "--nickname", "From cleo, ß 語"),
            lambda _: mine()[0][normal(edited["identifier"])]["properties"].get("Nickname") == "From cleo, ß 語")
    carried("a member that the subscriber takes out of a group", subscriber, owner,
            lambda: subscriber.run("group", "remove", group["identifier"], leaver),
            lambda _: normal(leaver) not in [normal(m) for m in mine()[1][normal(group["identifier"])]["members"]])
    carried("a group that the subscriber renames", subscriber, owner,
            lambda: subscriber.run("group", "rename", group["identifier"], "Cleo's name"),
            lambda _: mine()[1][normal(group["identifier"])]["name"] == "Cleo's name")
    carried("a person whom the subscriber deletes", subscriber, owner,
            lambda: subscriber.run("delete", victim["identifier"], "--yes"),
            lambda _: normal(victim["identifier"]) not in mine()[0])


def tree(view):
    """Every contact and group on the store with its contents; the clock file is left out."""
    found = {}
    for bucket in range(32):
        for uid in view.names("People", str(bucket))[0]:
            found[uid] = view.contact(uid)
    files, directories = view.names()
    for name in files | directories:
        if name.endswith("CXGroup"):
            found[name] = view.plist(name)
    return found


def unsubscription(owner, subscriber, view):
    """Ends a subscription that may write, and begins it again: nothing of it is carried to the owner's tree."""
    before = tree(view)
    talk(subscriber, "unsubscribe", owner.name, "--yes")
    left = [r for r in subscriber.json("list") + subscriber.json("group", "list") if r["owner"]]
    subscriber.run("sync")
    owner.run("sync")
    check(not left and tree(view) == before,
          f"no copy is left, and the owner's tree of {len(before)} contacts and groups is as it was")
    talk(subscriber, "subscribe", owner.name)
    check_copies(owner, subscriber, "subscribed again")


def withdrawal(owner, subscriber, withdraw):
    """The owner withdraws; the copies leave, are kept, and the person learns of it."""
    count = len(subscriber.json("list", "--of", owner.name))
    withdraw()
    began = time.monotonic()
    subscriber.run("sync", may=(0, 5))  # 5: the pass found that the right to read has gone
    gone = time.monotonic() - began
    summary.append(("  the copies leave", gone, "ok"))
    left = [p for p in subscriber.json("list") if p["owner"]]
    check(not left and subscriber.json("subscriptions") == [],
          f"the {count} copies have left, and the subscription with them, in a pass of {gone:.2f} s")
    notice = subscriber.json("status")["withdrawn"][0]
    check(notice["user"] == owner.name and notice["people"] == count and os.path.exists(notice["file"]),
          f"the notice is in `rolvane status`, and {count} people are kept in {os.path.basename(notice['file'])}")
    for line in subscriber.run("status").splitlines():
        if line.startswith("Withdrawn"):
            say(f"{subscriber.name}: {' '.join(line.split())}")
    return notice


def taken_back(subscriber, notice):
    report = subscriber.json("withdrawn", "import", notice["name"])
    check(report["imported"] == notice["people"] and report["bad"] == 0,
          f"`rolvane withdrawn import` takes all {report['imported']} back as {subscriber.name}'s own")


def subscription(world, owner, endpoint, authority):
    subscriber, stranger = (Person(name, owner.build, world.root) for name in ("cleo", "dan"))
    for person in (subscriber, stranger):
        world.at_end(person.leave)
        sign_up(person, owner, endpoint, authority)
    view = StoreView(endpoint, owner.name, PASSWORD, authority)
    with Step("Nothing is shared with anybody yet"):
        for person in (subscriber, stranger):
            code, said = talk(person, "subscribe", owner.name, may=(5,))
            check("does not let you read" in said, f"{person.name} gets nothing: exit code {code}")
    with Step("The owner shares for reading"):
        talk(owner, "share", subscriber.name)
        check([{**share, "readsSince": bool(share["readsSince"])} for share in owner.json("shares")] ==
              [{"user": "cleo", "rights": "read", "readsSince": True, "writesSince": None, "store": "read", "agrees": True}],
              "the store has it")
    with Step("Subscribe to the contacts of another user"):
        began = time.monotonic()
        talk(subscriber, "subscribe", owner.name)
        say(f"✓ `rolvane subscribe` returned after {time.monotonic() - began:.2f} s")
        check_copies(owner, subscriber, "first pass")
        refused_edit(owner, subscriber)
    with Step("The owner edits, adds, deletes, renames and regroups"):
        owner_edits(owner, subscriber)
        check_copies(owner, subscriber, "after the owner's edits")
    with Step("The owner shares for writing, and the subscriber edits"):
        talk(owner, "share", subscriber.name, "--write")
        carried("the right to write", owner, subscriber, lambda: None,
                lambda _: subscriber.json("subscriptions")[0]["writable"])
        subscriber_edits(owner, subscriber)
        subscriber.run("sync")
        check_copies(owner, subscriber, "after the subscriber's edits")
    with Step("Clients of both people's address books edit"):
        client_edits(world, owner, subscriber)
        check_copies(owner, subscriber, "after the clients' edits")
    with Step("The subscriber, who may write, unsubscribes and subscribes again"):
        unsubscription(owner, subscriber, view)
    with Step("The owner takes the rights back"):
        withdrawal(owner, subscriber, lambda: talk(owner, "unshare", subscriber.name))
        check(owner.json("shares") == [], "the store has it")
    with Step("The owner shares again, and withdraws the publication"):
        talk(owner, "share", subscriber.name)
        talk(subscriber, "subscribe", owner.name)
        check_copies(owner, subscriber, "subscribed once more")
        notice = withdrawal(owner, subscriber, lambda: talk(owner, "unpublish", "--yes"))
        taken_back(subscriber, notice)
    with Step("A third user, never granted anything"):
        code, _ = talk(stranger, "subscribe", owner.name, may=(3, 5))
        check(stranger.json("list") == [], f"has nothing: exit code {code}")
