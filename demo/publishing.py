"""The publishing side: an owner, a store, and a reader of its own that compares the two."""

import os
import re
import signal
import subprocess
import time

from steps import PASSWORD, Step, check, say, sign_up, summary
from storeview import StoreView, differences, normal
from terminal import converse
from world import Failure, Person, wait_until

EDIT_SECONDS = 2.0


def database_of(person):
    return person.json("list", "--full", "--own"), person.json("group", "list", "--own")


def check_equal(person, view, what):
    people, groups = database_of(person)
    found = differences(view, people, groups)
    for difference in found[:20]:
        say(f"✗ {difference}")
    if found:
        raise Failure(f"{what}: store and database differ in {len(found)} places")
    say(f"✓ {what}: {len(people)} people and {len(groups)} groups on the store are those of the database, "
        f"compared field by field")


def watch(person):
    """A running `rolvane watch` that hears everything from now on."""
    watching = person.start("watch", "--json", "--seconds", "600", stdout=subprocess.PIPE)
    if '"watching"' not in watching.stdout.readline():
        raise Failure("`rolvane watch` did not start")
    return watching


def publish(person):
    """Publishes everything and shows the progress that the daemon announces."""
    watching = watch(person)
    publishing = person.start("publish", stdout=subprocess.DEVNULL, stderr=subprocess.PIPE)
    talk = publishing.communicate()[1]
    if publishing.returncode != 0:
        watching.kill()
        raise Failure(f"`rolvane publish` ended with {publishing.returncode}: {talk.strip()}")
    heard = ""
    for line in watching.stdout:  # two programs hear of the end, and this one may be the later of them
        heard += line
        if '"stopped"' in line:
            break
    watching.send_signal(signal.SIGINT)
    heard += watching.communicate()[0]
    steps = re.findall(r'"event":"progress".*?"fraction":([0-9.e-]+)', heard)
    for line in talk.strip().splitlines():
        say(line)
    check(len(steps) > 0 and '"stopped"' in heard, f"progress was announced {len(steps)} times, then the end")


def timed_edit(view, title, command, arrived):
    """Runs one command and measures how long after its return the store has what it should have."""
    result = command()
    began = time.monotonic()
    wait_until(lambda: arrived(result), EDIT_SECONDS, title)
    delay = time.monotonic() - began
    say(f"✓ {title}: on the store {delay * 1000:.0f} ms after the command returned")
    summary.append((f"  {title}", delay, "ok"))
    return result


def edits(person, view):
    people, groups = database_of(person)
    view.patience, view.connection = 0.5, None
    victim, edited = people[7]["identifier"], people[3]["identifier"]
    first, second = groups[0], next(g for g in groups if g["identifier"] != groups[0]["identifier"])
    mover = next(uid for uid in first["members"] if uid not in second["members"] and uid != victim)

    timed_edit(view, "an edited person",
               lambda: person.run("edit", edited, "--nickname", "Edited, with ü and 字"),
               lambda _: ((view.contact(normal(edited)) or {}).get("Nickname") == "Edited, with ü and 字", "old nickname"))

    def added(result):
        uid = normal(result.strip())
        stored = view.contact(uid)
        if not stored or stored.get("Phone", {}).get("values") != ["+1 555 0100"]:
            return False, "no such contact"
        listed = uid in view.plist("AllCXGroup")["memberUIDState"] and uid in view.plist(normal(first["identifier"]))["memberUIDState"]
        return listed, "not listed as a member"

    timed_edit(view, "an added person, member of a group",
               lambda: person.run("add", "--first", "Nova", "--last", "Newcomer", "--phone", "mobile:+1 555 0100",
                                  "--group", first["identifier"]), added)

    def deleted(_):
        uid = normal(victim)
        gone = view.contact(uid) is None and uid not in view.plist("AllCXGroup")["memberUIDState"]
        return gone, "still there"

    timed_edit(view, "a deleted person", lambda: person.run("delete", victim, "--yes"), deleted)
    timed_edit(view, "a renamed group",
               lambda: person.run("group", "rename", second["identifier"], "Renamed – 名前"),
               lambda _: (view.plist(normal(second["identifier"]))["GroupName"] == "Renamed – 名前", "old name"))

    def moved(_):
        uid = normal(mover)
        there = uid in view.plist(normal(second["identifier"]))["memberUIDState"]
        return there and uid not in view.plist(normal(first["identifier"]))["memberUIDState"], "not moved"

    def move():
        person.run("group", "remove", first["identifier"], mover)
        person.run("group", "add", second["identifier"], mover)

    timed_edit(view, "a member moved to another group", move, moved)


def offline_edits(person, view, store_owner):
    people = person.json("list")
    chosen = [p["identifier"] for p in people[20:40]]
    log = os.path.join(os.path.dirname(store_owner.json("store", "status")["errorLog"]), "access.log")
    store_owner.run("store", "stop")
    for i, uid in enumerate(chosen):
        person.run("edit", uid, "--note", f"written while the store was away, {i}")
    wait_until(lambda: ((n := person.json("status")["pending"]) >= 20, f"{n} are queued"), 60, "20 edits in the queue")
    say(f"✓ {person.json('status')['pending']} changes wait in the queue")
    began = os.path.getsize(log)
    store_owner.run("store", "start", "--access-log")
    view.connection = None
    person.run("sync")
    check(person.json("status")["pending"] == 0, "after the store came back nothing is pending")
    with open(log, "rb") as lines:
        lines.seek(began)
        text = lines.read().decode()
    for i, uid in enumerate(chosen):
        name = normal(uid)
        stored = (view.contact(name) or {}).get("Note")
        if stored != f"written while the store was away, {i}":
            raise Failure(f"the edit of {name} did not arrive; the store has {stored!r}")
        puts = len(re.findall(rf" PUT 20[14] \d+ \S*{name.split(':')[0]}", text))
        if puts != 1:
            raise Failure(f"{name} was written {puts} times")
    say(f"✓ all {len(chosen)} edits arrived, each written once")


def kill_in_the_middle(person, view):
    cards = os.path.join(person.home, "many.vcf")
    with open(cards, "w") as out:
        for i in range(2000):
            out.write(f"BEGIN:VCARD\r\nVERSION:4.0\r\nFN:Person {i:04}\r\nN:Number {i:04};Person;;;\r\n"
                      f"TEL;TYPE=home:+1-555-{i:04}\r\nEMAIL:p{i}@example.org\r\nNOTE:One of many\\nwith two lines\r\n"
                      "END:VCARD\r\n")
    person.run("import", cards)
    watching = watch(person)
    person.run("publish", "--no-wait")
    killed = None
    for line in watching.stdout:
        step = re.search(r'"fraction":([0-9.e-]+)', line)
        if step and float(step[1]) > 0.3:
            killed = person.daemon()
            os.kill(killed, signal.SIGKILL)
            break
    watching.send_signal(signal.SIGINT)
    watching.communicate()
    if killed is None:
        raise Failure("the daemon announced no progress")
    wait_until(lambda: (person.daemon() is None, "still there"), 10, "the killed daemon")
    there = sum(len(view.names("People", str(i))[0]) for i in range(32))
    check(0 < there < 2000, f"killed in the middle: {there} of 2000 people were on the store")
    person.run("daemon", "start")
    person.run("sync")
    check_equal(person, view, "after a new start")
    check(person.json("status")["pending"] == 0, "nothing is pending")


def strangers(person, view, endpoint, authority):
    """The tree as tools see it that know nothing of Rolvane."""
    base = endpoint.replace("{user}", person.name)
    somebody = person.json("list", "--full")[0]
    uid = normal(somebody["identifier"])
    netrc = os.path.join(person.home, ".netrc")
    with open(netrc, "w") as out:
        out.write(f'machine localhost\nlogin {person.name}\npassword "{PASSWORD}"\n')
    os.chmod(netrc, 0o600)

    got = subprocess.run(["curl", "--silent", "--show-error", "--fail", "--cacert", authority, "--netrc-file", netrc,
                          f"{base}/People/{view.bucket(uid)}/{uid}"], capture_output=True, text=True)
    check(got.returncode == 0 and "<plist" in got.stdout and got.stdout.rstrip().endswith("</plist>"),
          f"curl reads {somebody['name']} as a property list of {len(got.stdout)} characters")

    prompt = r"dav:[^\n]*[>?] "
    listed = converse(["cadaver"], person.environment,
                      [(prompt, f"open {base}/"), (r"\(y/n\)", "y"), (prompt, "ls"),
                       (prompt, f"cd People/{view.bucket(uid)}"), (prompt, "ls"), (prompt, "quit")])
    groups = len(set(re.findall(r"\S+CXGroup", listed)))
    expected = len(person.json("group", "list")) + 1
    if uid[:20] not in listed or groups < expected:
        say(listed)
    check(uid[:20] in listed and groups >= expected,
          f"cadaver lists the {expected} group files and, in the bucket, {uid}")


def publishing(world, ada, endpoint, authority):
    """Everything that one publisher does, and what a second one survives."""
    view = StoreView(endpoint, ada.name, PASSWORD, authority)
    with Step("Publish everything"):
        publish(ada)
        check_equal(ada, view, "first publication")

    with Step("Edit while the daemon runs"):
        edits(ada, view)
        view.patience, view.connection = 20, None
        ada.run("sync")
        check_equal(ada, view, "after the edits")

    with Step("20 edits while the store is away"):
        offline_edits(ada, view, ada)
        check_equal(ada, view, "after the store came back")

    with Step("SIGKILL in the middle of a publication of 2,000 people"):
        bob = Person("bob", ada.build, world.root)
        world.at_end(bob.leave)
        sign_up(bob, ada, endpoint, authority)
        kill_in_the_middle(bob, StoreView(endpoint, "bob", PASSWORD, authority))

    with Step("Read the tree with tools that know nothing of Rolvane"):
        view.connection = None
        strangers(ada, view, endpoint, authority)
