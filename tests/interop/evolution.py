"""The books in Evolution's data server: its CardDAV backend, driven through libebook by `evolution-client`, with the
registry and the address book factory of a person's own."""

import json
import os
import subprocess
import time

from world import Failure

HERE = os.path.dirname(os.path.abspath(__file__))
NAMES = "org.gnome.evolution.dataserver."
PROGRAMS = (("Sources5", "evolution-source-registry"), ("AddressBook10", "evolution-addressbook-factory"))
PNG = ("89504e470d0a1a0a0000000d4948445200000001000000010802000000907753de0000000c4944415478da63f8cfc0000003"
       "010100c9fe92ef0000000049454e44ae426082")
PATIENCE = 60  # seconds
NO_WAIT = 0xFFFFFFFF  # libebook's word for it
SOURCE = """[Data Source]
DisplayName={name}
Enabled=true
Parent=carddav-stub

[Address Book]
BackendName=carddav

[Authentication]
Host=localhost
Method=plain/password
Port={port}
User={device}

[Offline]
StaySynchronized=true

[Security]
Method=tls

[WebDAV Backend]
ResourcePath=/books/home/{book}/
"""


class DataServer:
    """A book in the data server. Both programs are this person's, and end with `stop`."""

    def __init__(self, person, book, device="evolution"):
        self.person, self.name = person, f"rolvane-{book}"
        self.environment = dict(person.environment, GSETTINGS_BACKEND="memory")
        self.password = os.path.join(person.home, f"{self.name}.password")
        self.programs, self.client = [], None
        with open(self.password, "w") as out:
            out.write(person.device(device))
        sources = os.path.join(person.environment["XDG_CONFIG_HOME"], "evolution/sources")
        os.makedirs(sources, exist_ok=True)
        port = person.url.rstrip("/").rsplit(":", 1)[1]
        with open(os.path.join(sources, f"{self.name}.source"), "w") as out:
            out.write(SOURCE.format(name=book, port=port, device=device, book=book))

    def start(self):
        for name, program in PROGRAMS:
            self.programs.append(subprocess.Popen(["/usr/libexec/" + program], env=self.environment,
                                                  stderr=subprocess.DEVNULL))
            subprocess.run(["gdbus", "wait", "--session", "--timeout", "60", NAMES + name], env=self.environment,
                           check=True)
        certificate = os.path.join(os.path.dirname(self.person.authority), "server.pem")
        self.client = subprocess.Popen([os.path.join(HERE, "evolution-client"), self.name, self.password, certificate],
                                       env=self.environment, stdin=subprocess.PIPE, stdout=subprocess.PIPE, text=True)

    def stop(self):
        for process in [self.client] * bool(self.client) + self.programs[::-1]:
            process.kill()
            process.communicate()
        self.programs, self.client = [], None

    def ask(self, *request):
        self.client.stdin.write(json.dumps(request) + "\n")
        self.client.stdin.flush()
        line = self.client.stdout.readline()
        answer = json.loads(line) if line else {"error": "the client ended"}
        if "error" in answer:
            raise Failure(f"the data server's {request[0]}: {answer['error']}")
        return answer["good"]

    def cards(self):
        return {uid: card.replace("\r\n ", "") for uid, card in self.ask("cards").items()}

    def wait(self, test, what):
        """Refreshes until the cards that it has are as they should be. One alone may say no more than "later": the data
        server works in threads of its own, and signs in anew after a failure."""
        end = time.monotonic() + PATIENCE
        while not test(self.cards()):
            if time.monotonic() > end:
                raise Failure(f"{what}: the data server has {sorted(self.cards().values())} after {PATIENCE} seconds")
            self.ask("refresh")
            time.sleep(0.1)

    def uid_of(self, name):
        found = [uid for uid, card in self.cards().items() if f"FN:{name}\r\n" in card]
        if len(found) != 1:
            raise Failure(f"the data server has {len(found)} contacts {name}")
        return found[0]


def has(cards, *words):
    """One of the cards has all of the words."""
    return any(all(word in card for word in words) for card in cards.values())


def evolution(person, check):
    for first in ("Ann", "Bob"):
        person.run("add", "--first", first, "--last", "Lee", "--phone", "home:555 0100")
    group = person.run("group", "create", "Friends", "Ann Lee").split(":")[0]
    server = DataServer(person, "contacts")
    try:
        server.start()
        check(server.ask("open", PATIENCE), "the data server signs in and opens the book")
        server.wait(lambda cards: has(cards, "FN:Ann Lee") and has(cards, "FN:Bob Lee"), "two contacts")
        both_ways(person, server, check)
        older_edit(person, server, check)
        edit_of_the_deleted(person, server, check)
        offline(person, server, check)
        cards = server.cards()
        people = [card for card in cards.values() if "KIND:group" not in card]
        check(len(people) == len(person.json("list")), f"both sides have the same {len(people)} people at the end")
    finally:
        server.stop()
    server = DataServer(person, f"group-{group}", "group")
    try:
        server.start()
        server.ask("open", PATIENCE)
        server.wait(lambda cards: has(cards, "FN:Ann Lee"), "the group's member")
        server.ask("add", "BEGIN:VCARD\r\nVERSION:3.0\r\nN:Day;Dora;;;\r\nFN:Dora Day\r\nEND:VCARD\r\n")
        check("Dora Day" in person.run("list", "--group", "Friends"), "who is added to the group's book joins the group")
        server.ask("remove", server.uid_of("Ann Lee"))
        check("Ann Lee" not in person.run("list", "--group", "Friends") and person.json("list", "Ann Lee"),
              "who is deleted there leaves the group and stays a contact")
    finally:
        server.stop()


def both_ways(person, server, check):
    uid = server.ask("add", "BEGIN:VCARD\r\nVERSION:3.0\r\nN:Evo;Eva;;;\r\nFN:Eva Evo\r\nTEL;TYPE=HOME:5\r\nEND:VCARD\r\n")
    check(len(person.json("list", "Eva Evo")) == 1, "a contact that is made there is here, once")
    server.ask("change", uid, "nickname", "Evi")
    check("Evi" in person.run("show", "Eva Evo"), "and what is changed there")
    server.ask("photo", uid, PNG)
    check("Photo" in person.run("show", "Eva Evo"), "and a photo")
    person.run("edit", "Eva Evo", "--note", "changed here")
    server.wait(lambda cards: has(cards, "FN:Eva Evo", "NOTE:changed here", "NICKNAME:Evi", "PHOTO"),
                "what is changed here")
    check(True, "a change made here is there, with nickname and photo still")
    person.run("add", "--first", "Hal", "--last", "Here")
    server.wait(lambda cards: has(cards, "FN:Hal Here"), "who is added here")
    person.run("delete", "Hal Here", "--yes")
    server.wait(lambda cards: not has(cards, "FN:Hal Here"), "who is deleted here")
    check(True, "who is added and then deleted here comes and goes there")
    server.ask("remove", uid)
    check(person.json("list", "Eva Evo") == [], "who is deleted there is gone here")


def older_edit(person, server, check):
    """The data server writes without If-Match, over a version that it has not read."""
    uid = server.uid_of("Bob Lee")
    person.run("edit", "Bob Lee", "--note", "newer")
    server.ask("change", uid, "nickname", "Bobby")
    shown = person.run("show", "Bob Lee")
    check("newer" in shown and "Bobby" in shown and "555 0100" in shown,
          "an edit of an older version there takes nothing of the newer one here")
    server.wait(lambda cards: has(cards, "FN:Bob Lee", "NOTE:newer", "NICKNAME:Bobby"), "what both have changed")
    check(True, "and there it has both, too")


def edit_of_the_deleted(person, server, check):
    person.run("add", "--first", "Una", "--last", "Lee")
    server.wait(lambda cards: has(cards, "FN:Una Lee"), "who is added here")
    uid = server.uid_of("Una Lee")
    person.run("delete", "Una Lee", "--yes")
    try:
        server.ask("change", uid, "nickname", "Uni")
        said = ""
    except Failure as failure:
        said = str(failure)
    check(said and person.json("list", "Una Lee") == [],
          f"an edit there of somebody who was deleted here brings nobody back, and is told: {said}")
    server.wait(lambda cards: not has(cards, "FN:Una Lee"), "who is deleted here")


def offline(person, server, check):
    """Changes that the data server keeps until it gets at the books. It sends them with If-Match, and gives up the one to
    a contact that was changed here meanwhile."""
    person.run("add", "--first", "Cem", "--last", "Lee")
    server.wait(lambda cards: has(cards, "FN:Cem Lee"), "who is added here")
    server.stop()
    person.run("books", "off")
    server.start()
    server.ask("open", NO_WAIT)
    server.ask("change", server.uid_of("Bob Lee"), "nickname", "Robert")
    server.ask("change", server.uid_of("Cem Lee"), "nickname", "Jim")
    server.ask("add", "BEGIN:VCARD\r\nVERSION:3.0\r\nN:Off;Olga;;;\r\nFN:Olga Off\r\nEND:VCARD\r\n")
    server.ask("remove", server.uid_of("Ann Lee"))
    person.run("edit", "Cem Lee", "--note", "meanwhile")
    person.run("add", "--first", "Dan", "--last", "Lee")
    check("Robert" not in person.run("show", "Bob Lee"), "without the books the data server keeps its changes")
    person.run("books", "on")
    server.wait(lambda cards: "Robert" in person.run("show", "Bob Lee"), "the change made offline")
    server.wait(lambda cards: len(person.json("list", "Olga Off")) == 1, "who was added offline")
    server.wait(lambda cards: person.json("list", "Ann Lee") == [], "who was deleted offline")
    server.wait(lambda cards: has(cards, "FN:Bob Lee", "NOTE:newer", "NICKNAME:Robert") and has(cards, "FN:Olga Off") and
                has(cards, "FN:Dan Lee") and has(cards, "FN:Cem Lee", "NOTE:meanwhile"), "what was changed here meanwhile")
    check("newer" in person.run("show", "Bob Lee") and "meanwhile" in person.run("show", "Cem Lee"),
          "what was made offline arrives, takes nothing away, and what was changed here meanwhile is there")
    person.run("add", "--first", "Ann", "--last", "Lee")
    person.run("group", "add", "Friends", "Ann Lee")
    server.wait(lambda cards: has(cards, "FN:Ann Lee"), "Ann again")
