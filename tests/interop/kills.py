"""Two CardDAV clients and a subscriber change the same contacts at once, while the server of the books and both people's
daemons are killed again and again. Nothing may be lost, and nothing doubled."""

import os
import random
import re
import shutil
import signal
import subprocess
import threading
import time
import urllib.error

from steps import sign_up
from world import Failure, Person

PATIENCE = 120  # seconds until both databases agree after the last edit
SHARED = 5  # contacts that everybody edits


def killed(pid):
    """Kills a process and its children, so that none of them goes on alone."""
    try:
        os.kill(pid, signal.SIGSTOP)
        with open(f"/proc/{pid}/task/{pid}/children") as file:
            for child in file.read().split():
                os.kill(int(child), signal.SIGKILL)
        os.kill(pid, signal.SIGKILL)
    except (FileNotFoundError, ProcessLookupError):
        pass  # it has just ended


class Words:
    """What was written for good: addresses by contact. Threads share it."""

    def __init__(self):
        self.lock, self.count, self.of = threading.Lock(), 0, {}

    def new(self, who):
        with self.lock:
            self.count += 1
            return f"{who}{self.count}@example.org"

    def add(self, name, word):
        with self.lock:
            self.of.setdefault(name, set()).add(word)

    def drop(self, name):
        with self.lock:
            self.of.pop(name)


class Client(threading.Thread):
    """A program that edits by CardDAV. It asks again when it gets no answer, and reads anew where the card has changed."""

    def __init__(self, name, dav, words, edits, seed):
        super().__init__(name=name, daemon=True)
        self.dav, self.words, self.edits = dav, words, edits
        self.random, self.failure, self.held = random.Random(seed), None, {}
        self.conditions = {"met": 0, "late": 0, "none": 0, "repeated": 0}
        self.story = []  # of requests that change something, for whoever looks for what was lost

    def run(self):
        try:
            for _ in range(self.edits):
                self.random.choice([self.edit] * 4 + [self.make_and_delete, self.make])()
        except Exception as error:
            self.failure = f"{self.name}: {error!r}"

    def ask(self, *request, **headers):
        """The answer, whenever there is one; (None, ...) where the connection broke off, so that nobody knows."""
        end = time.monotonic() + PATIENCE
        while time.monotonic() < end:
            try:
                status, answered, body = self.dav.request(*request, **headers)
            except (OSError, urllib.error.URLError, EOFError) as error:
                refused = isinstance(getattr(error, "reason", error), ConnectionRefusedError)
                if not refused and request[0] != "GET":
                    return None, None, None
                time.sleep(0.02)
                continue
            except Exception:  # a body that breaks off
                if request[0] != "GET":
                    return None, None, None
                continue
            if status != 503:
                return status, answered, body
            time.sleep(0.02)
        raise Failure(f"{request[0]} {request[1]} got no answer in {PATIENCE} seconds")

    def address(self, name):
        return self.dav.url + f"{name}.vcf"

    def read(self, name):
        status, answered, body = self.ask("GET", self.address(name))
        if status != 200:
            raise Failure(f"GET of {name}: {status}")
        self.held[name] = body, answered.get("ETag")

    def edit(self):
        """One more address. Sometimes without If-Match, over a version that may be an older one."""
        name, word = f"Shared{self.random.randrange(SHARED)}", self.words.new(self.name)
        blind = self.random.random() < 0.3
        if not blind or name not in self.held:
            self.read(name)
        while True:
            card, tag = self.held[name]
            if word in card:  # it arrived without an answer
                self.conditions["repeated"] += 1
                break
            card = card.replace("END:VCARD", f"EMAIL;TYPE=HOME:{word}\r\nEND:VCARD")
            condition = {} if blind else {"If_Match": tag}
            status, answered, body = self.ask("PUT", self.address(name), card, Content_Type="text/vcard", **condition)
            self.story.append((time.time(), name, word, tag, "blind" if blind else "tag", status,
                               answered and answered.get("ETag"), sorted(re.findall(r"(\w+)@example", card))))
            if status in (201, 204):
                self.conditions["none" if blind else "met"] += 1
                self.read(name)
                break
            if status not in (None, 412):
                raise Failure(f"PUT of {name}: {status} {body}")
            self.conditions["late"] += status == 412
            self.read(name)
        self.words.add(name, word)

    def make(self):
        word = self.words.new(self.name)
        name = "Made" + word.split("@")[0]
        card = (f"BEGIN:VCARD\r\nVERSION:3.0\r\nUID:{name}\r\nFN:{name}\r\nN:;{name};;;\r\n"
                f"EMAIL;TYPE=HOME:{word}\r\nEND:VCARD\r\n")
        status, repeated = None, False
        while status is None:
            status, _, body = self.ask("PUT", self.address(name), card, Content_Type="text/vcard", If_None_Match="*")
            if not (status in (None, 201) or (status == 412 and repeated)):
                raise Failure(f"PUT of {name}: {status} {body}")
            repeated = True
        self.words.add(name, word)
        return name

    def make_and_delete(self):
        name, status = self.make(), None
        while status is None:
            status, _, body = self.ask("DELETE", self.address(name))
        if status not in (204, 404):
            raise Failure(f"DELETE of {name}: {status} {body}")
        self.words.drop(name)


class Subscriber(threading.Thread):
    """Edits the same contacts in a database of their own, as `rolvane edit` does."""

    def __init__(self, person, words, edits, seed):
        super().__init__(name=person.name, daemon=True)
        self.person, self.words, self.edits = person, words, edits
        self.random, self.failure = random.Random(seed), None

    def run(self):
        try:
            for _ in range(self.edits):
                name, word = f"Shared{self.random.randrange(SHARED)}", self.words.new("s")
                self.person.run("edit", name, "--email", f"work:{word}")
                self.words.add(name, word)
                self.person.run("sync", may=(0, 1, 6))
        except Exception as error:
            self.failure = f"{self.name}: {error!r}"


def emails(person, *which):
    """Addresses by name; a name that is there twice is a failure."""
    found = {}
    for one in person.json("list", "--full", *which):
        name = one["properties"]["First"]
        if name in found:
            raise Failure(f"{person.name} has two of {name}")
        found[name] = sorted(one["properties"].get("Email", {}).get("values", []))
    return found


def agree(people, words):
    """Passes until everybody has exactly what was written."""
    wanted = {name: sorted(those) for name, those in words.of.items()}
    end, said = time.monotonic() + PATIENCE, ""
    while time.monotonic() < end:
        for person, _ in people:
            person.run("sync", may=(0, 1, 6))
        said = ""
        for person, which in people:
            found = emails(person, which)
            for name in sorted(set(wanted) | set(found)):
                if found.get(name) != wanted.get(name):
                    missing = set(wanted.get(name, [])) - set(found.get(name) or [])
                    said += f"{person.name}: {name} lacks {sorted(missing)} of {len(wanted.get(name, []))}, has " \
                            f"{found.get(name)}\n"
        if not said:
            return
    raise Failure(f"after {PATIENCE} seconds of passes:\n{said}")


def kills(build, root, make_owner, check, edits, seed):
    print(f"  seed {seed}", flush=True)
    chance, words = random.Random(seed), Words()
    owner, subscriber = make_owner("ada"), Person("bob", build, root)
    try:
        store = owner.json("store", "start")
        sign_up(owner, owner, store["endpoint"], store["caFile"])
        sign_up(subscriber, owner, store["endpoint"], store["caFile"])
        for number in range(SHARED):
            name = f"Shared{number}"
            dav = owner.book("contacts", f"first{number}")
            card = f"BEGIN:VCARD\r\nVERSION:3.0\r\nUID:{name}\r\nFN:{name}\r\nN:;{name};;;\r\nEND:VCARD\r\n"
            dav.request("PUT", dav.url + f"{name}.vcf", card, Content_Type="text/vcard", If_None_Match="*")
            words.of[name] = set()
        owner.run("publish")
        owner.run("share", "bob", "--write")
        subscriber.run("subscribe", "ada")
        clients = [Client(name, owner.book("contacts", name), words, edits, f"{seed} {name}") for name in ("laptop", "phone")]
        writers = clients + [Subscriber(subscriber, words, edits, f"{seed} bob")]
        for writer in writers:
            writer.start()
        daemons = {"the owner's daemon": owner, "the subscriber's daemon": subscriber}
        count = {"httpd": 0, "a worker of httpd": 0, **{name: 0 for name in daemons}}
        while any(writer.is_alive() for writer in writers) or not all(count.values()):
            what, pid = chance.choice(list(count)), None
            if what in daemons:
                asked = daemons[what].start("sync", stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)
                while not pid and asked.poll() is None:
                    pid = daemons[what].daemon()
            else:
                pid = owner.json("books", "status", may=(0, 3)).get("process")
            time.sleep(chance.uniform(0, 0.3))  # a random moment
            if pid and what == "a worker of httpd":
                with open(f"/proc/{pid}/task/{pid}/children") as file:
                    for child in file.read().split():
                        os.kill(int(child), signal.SIGKILL)
            elif pid:
                killed(pid)
            count[what] += bool(pid)
            if what == "httpd":
                owner.run("books", "on")
            if what in daemons:
                asked.wait()
        for writer in writers:
            writer.join()
        failures = [writer.failure for writer in writers if writer.failure]
        if failures:
            raise Failure("; ".join(failures))
        try:
            agree([(owner, "--own"), (subscriber, "--of=ada")], words)
        except Failure:
            keep = os.environ.get("ROLVANE_KEEP")  # a directory for the databases and what the clients did
            if keep:
                shutil.copytree(root, keep, dirs_exist_ok=True, ignore_dangling_symlinks=True,
                                ignore=lambda _, names: [name for name in names if "sock" in name or "bus" in name])
                with open(os.path.join(keep, "story"), "w") as file:
                    for client in clients:
                        file.writelines(f"{client.name} {line}\n" for line in client.story)
            raise
        served = len([name for name in owner.book().names()])
        check(served == len(words.of), f"{served} cards are served, as many as there are contacts")
        how = {key: sum(client.conditions[key] for client in clients) for key in clients[0].conditions}
        check(how["met"] > 0, f"{words.count} edits by two clients ({how}) and a subscriber, {count} killed: nothing lost, "
              "nothing doubled")
    finally:
        for end in (subscriber.leave, lambda: owner.run("store", "stop", "--now", may=(0, 1)), owner.leave):
            end()
