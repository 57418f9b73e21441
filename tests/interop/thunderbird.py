"""The books in Thunderbird: the program itself, without a window, driven through its remote control (Marionette). What it
is asked to do is what its menus do: its own search for books, its own address book, its own synchronisation."""

import json
import os
import socket
import subprocess
import time

from world import Failure, wait_until

PROGRAM = "/usr/lib/thunderbird/thunderbird-bin"  # /usr/bin has a script that may ask questions
PATIENCE = 120  # seconds
PREFERENCES = {
    "app.update.enabled": False,
    "datareporting.policy.dataSubmissionEnabled": False,
    "mail.provider.enabled": False,
    "mail.shell.checkDefaultClient": False,
    "mail.spotlight.firstRunDone": True,
    "mailnews.start_page.enabled": False,
    "marionette.port": 0,  # a free one, which it writes into its profile
    "network.captive-portal-service.enabled": False,
    "network.connectivity-service.enabled": False,
}
# In front of each script. An address book is found by its name.
HELP = """
const { MailServices } = ChromeUtils.importESModule("resource:///modules/MailServices.sys.mjs");
const { CardDAVDirectory } = ChromeUtils.importESModule("resource:///modules/CardDAVDirectory.sys.mjs");
const { CardDAVUtils } = ChromeUtils.importESModule("resource:///modules/CardDAVUtils.sys.mjs");
const { VCardUtils } = ChromeUtils.importESModule("resource:///modules/VCardUtils.sys.mjs");
const bookOf = name => CardDAVDirectory.forFile(MailServices.ab.directories.find(d => d.dirName == name).fileName);
const cardOf = (book, uid) => {
  const found = book.childCards.find(c => c.UID == uid);
  if (!found) throw new Error("no card " + uid);
  return found;
};
const run = async () => { BODY };
const done = arguments[arguments.length - 1];
run().then(good => done({ good: good ?? null }), error => done({ error: String(error) }));
"""


class Marionette:
    """Its remote control: texts of JSON, each behind its length."""

    def __init__(self, port):
        self.socket, self.rest, self.count = socket.create_connection(("127.0.0.1", port), timeout=PATIENCE), b"", 0
        self._read()
        self.ask("WebDriver:NewSession", capabilities={"alwaysMatch": {"timeouts": {"script": PATIENCE * 1000}}})
        self.ask("Marionette:SetContext", value="chrome")

    def _more(self):
        got = self.socket.recv(65536)
        if not got:
            raise Failure("Thunderbird has ended")
        self.rest += got

    def _read(self):
        while b":" not in self.rest:
            self._more()
        length, self.rest = self.rest.split(b":", 1)
        while len(self.rest) < int(length):
            self._more()
        text, self.rest = self.rest[:int(length)], self.rest[int(length):]
        return json.loads(text)

    def ask(self, command, **parameters):
        self.count += 1
        text = json.dumps([0, self.count, command, parameters]).encode()
        self.socket.sendall(str(len(text)).encode() + b":" + text)
        _, _, error, result = self._read()
        if error:
            raise Failure(f"Thunderbird's {command}: {error['error']}: {error['message']}")
        return result

    def script(self, body, *arguments):
        """What the asynchronous function's body gives; `arguments` are those given here."""
        said = self.ask("WebDriver:ExecuteAsyncScript", script="const given = arguments;" + HELP.replace("BODY", body),
                        args=list(arguments), newSandbox=True)["value"]
        if "error" in said:
            raise Failure(f"Thunderbird: {said['error']}")
        return said["good"]


class Thunderbird:
    """A person's Thunderbird, with a profile that stays until the person goes."""

    def __init__(self, person, display=None):
        self.person, self.profile, self.process, self.remote = person, os.path.join(person.home, "thunderbird"), None, None
        self.display = display  # an X server's; none: without windows
        os.makedirs(self.profile)
        with open(os.path.join(self.profile, "user.js"), "w") as out:
            for name, value in PREFERENCES.items():
                out.write(f"user_pref({json.dumps(name)}, {json.dumps(value)});\n")

    def start(self):
        told = os.path.join(self.profile, "MarionetteActivePort")
        if os.path.exists(told):
            os.unlink(told)
        window = [] if self.display else ["--headless"]
        # The last one lets the remote control at the program itself, not at web pages alone.
        self.process = subprocess.Popen(
            [PROGRAM, *window, "--no-remote", "--profile", self.profile, "--marionette", "--remote-allow-system-access"],
            env=dict(self.person.environment, **({"DISPLAY": self.display} if self.display else {})),
            stdout=subprocess.DEVNULL, stderr=subprocess.DEVNULL)

        def port():
            if self.process.poll() is not None:
                raise Failure(f"Thunderbird ended with {self.process.returncode}")
            return os.path.exists(told) and os.path.getsize(told) > 0, "it tells no port"
        wait_until(port, PATIENCE, "Thunderbird")
        with open(told) as file:
            self.remote = Marionette(int(file.read()))

    def stop(self):
        if self.process:
            try:
                self.remote.ask("Marionette:Quit", flags=["eAttemptQuit"])
                self.process.wait(PATIENCE)
            except (OSError, Failure, AttributeError, subprocess.TimeoutExpired):
                self.process.kill()
                self.process.wait()
        self.process = self.remote = None

    # Each a menu's entry.

    def trust(self, file):
        """Imports an authority, to identify websites."""
        with open(file) as text:
            inside = "".join(line.strip() for line in text if not line.startswith("-----"))
        self.remote.script("""
            Cc["@mozilla.org/security/x509certdb;1"].getService(Ci.nsIX509CertDB).addCertFromBase64(given[0], "C,,");
            """, inside)

    def add_books(self, location, device, password):
        """Add CardDAV Address Book, with all of them ticked; their names, and whether they may be written."""
        return self.remote.script("""
            const found = await CardDAVUtils.detectAddressBooks(given[1], given[2], given[0], false, true);
            const all = {};
            for (const each of found) {
              const filled = new Promise(resolve => {
                const observer = { observe(subject) {
                  Services.obs.removeObserver(observer, "addrbook-directory-synced"); resolve(); } };
                Services.obs.addObserver(observer, "addrbook-directory-synced");
              });
              const book = each.create();
              await filled;
              all[each.name] = !book.readOnly;
            }
            return all;""", location, device, password)

    def cards(self, book):
        """Cards by UID."""
        return self.remote.script("""
            const all = {};
            for (const card of bookOf(given[0]).childCards) all[card.UID] = card.getProperty("_vCard", "");
            return all;""", book)

    def sync(self, book):
        self.remote.script("await bookOf(given[0]).syncWithServer();", book)

    def add(self, book, card):
        """A new contact; its UID once the server has it."""
        return self.remote.script("""
            const book = bookOf(given[0]), card = VCardUtils.vCardToAbCard(given[1]);
            book.addCard(card);
            while (!cardOf(book, card.UID).getProperty("_etag", "")) await new Promise(r => Services.tm.dispatchToMainThread(r));
            return card.UID;""", book, card)

    def change(self, book, uid, line):
        """One more line in a card. It is sent without anybody's waiting for it."""
        self.remote.script("""
            const book = bookOf(given[0]), card = cardOf(book, given[1]);
            const text = card.getProperty("_vCard", "").replace("END:VCARD", given[2] + "\\r\\nEND:VCARD");
            const changed = VCardUtils.vCardToAbCard(text);
            for (const name of ["_etag", "_href"]) changed.setProperty(name, card.getProperty(name, ""));
            changed.directoryUID = book.UID;
            book.modifyCard(changed);""", book, uid, line)

    def send(self, book, uid, line):
        """Sends a card with one more line; what Thunderbird says of a failure."""
        return self.remote.script("""
            const book = bookOf(given[0]), card = cardOf(book, given[1]);
            card.setProperty("_vCard", card.getProperty("_vCard", "").replace("END:VCARD", given[2] + "\\r\\nEND:VCARD"));
            try { await book._sendCardToServer(card); } catch (error) { return String(error.message); }
            return "";""", book, uid, line)

    def delete(self, book, uid):
        self.remote.script("const book = bookOf(given[0]); book.deleteCards([cardOf(book, given[1])]);", book, uid)


def wait(test, what):
    end = time.monotonic() + PATIENCE
    while not test():
        if time.monotonic() > end:
            raise Failure(f"{what}: not in {PATIENCE} seconds")
        time.sleep(0.05)


def uid_of(cards, name):
    found = [uid for uid, card in cards.items() if f"FN:{name}\r\n" in card]
    if len(found) != 1:
        raise Failure(f"Thunderbird has {len(found)} contacts {name}: {sorted(cards.values())}")
    return found[0]


def thunderbird(person, check):
    for first in ("Ann", "Bob"):
        person.run("add", "--first", first, "--last", "Lee", "--phone", "home:555 0100")
    person.run("group", "create", "Friends", "Ann Lee")
    program = Thunderbird(person)
    try:
        program.start()
        program.trust(person.authority)
        found = program.add_books(person.url, "thunderbird", person.device("thunderbird"))
        check(found == {"Contacts": True, "Friends": True}, f"Thunderbird finds the books by the address alone: {found}")
        check(len(program.cards("Friends")) == 1, "the group's book has its member")
        both_ways(person, program, check)
        older_edit(person, program, check)
        edit_of_the_deleted(person, program, check)
        offline(person, program, check)
        of_group(person, program, check)
        forgotten(person, program, check)
        people = [card for card in program.cards("Contacts").values() if "KIND:group" not in card]
        check(len(people) == len(person.json("list")), f"both sides have the same {len(people)} people at the end")
    finally:
        program.stop()


def both_ways(person, program, check):
    uid = program.add("Contacts", "BEGIN:VCARD\r\nVERSION:4.0\r\nN:Bird;Thea;;;\r\nFN:Thea Bird\r\nTEL;TYPE=home:5\r\n"
                      "X-CUSTOM1;VALUE=TEXT:kept\r\nEND:VCARD\r\n")
    check(len(person.json("list", "Thea Bird")) == 1, "a contact that is made there is here, once")
    program.change("Contacts", uid, "NICKNAME:Tee")
    wait(lambda: "Tee" in person.run("show", "Thea Bird"), "a nickname of Thunderbird's")
    check(True, "and what is changed there")
    person.run("edit", "Thea Bird", "--note", "changed here")
    program.sync("Contacts")
    card = program.cards("Contacts")[uid]
    check(all(each in card for each in ("NOTE:changed here", "NICKNAME:Tee", "X-CUSTOM1")),
          "a change made here is there, with the rest and a field of Thunderbird's own")
    person.run("add", "--first", "Hal", "--last", "Here")
    program.sync("Contacts")
    uid_of(program.cards("Contacts"), "Hal Here")
    person.run("delete", "Hal Here", "--yes")
    program.sync("Contacts")
    check(not any("Hal Here" in each for each in program.cards("Contacts").values()),
          "who is added and then deleted here comes and goes there")
    program.delete("Contacts", uid)
    wait(lambda: person.json("list", "Thea Bird") == [], "a deletion of Thunderbird's")
    check(True, "who is deleted there is gone here")


def older_edit(person, program, check):
    """Thunderbird writes without If-Match, over a version that it has not read."""
    uid = uid_of(program.cards("Contacts"), "Bob Lee")
    person.run("edit", "Bob Lee", "--note", "newer")
    program.change("Contacts", uid, "NICKNAME:Bobby")
    wait(lambda: "Bobby" in person.run("show", "Bob Lee"), "the older edit")
    shown = person.run("show", "Bob Lee")
    check("newer" in shown and "555 0100" in shown, "an edit of an older version there takes nothing of the newer one here")
    program.sync("Contacts")
    card = program.cards("Contacts")[uid]
    check("NOTE:newer" in card and "NICKNAME:Bobby" in card, "and there it has both, too")


def edit_of_the_deleted(person, program, check):
    person.run("add", "--first", "Una", "--last", "Lee")
    program.sync("Contacts")
    uid = uid_of(program.cards("Contacts"), "Una Lee")
    person.run("delete", "Una Lee", "--yes")
    said = program.send("Contacts", uid, "NICKNAME:Uni")
    check(said == "" and person.json("list", "Una Lee") == [],
          "an edit there of somebody who was deleted here brings nobody back")
    program.sync("Contacts")
    check(person.json("list", "Una Lee") == [] and uid not in program.cards("Contacts"), "and Una is gone there, too")


def offline(person, program, check):
    """Changes that Thunderbird keeps until it gets at the books, over its own end and new start."""
    person.run("add", "--first", "Una", "--last", "Lee")
    program.sync("Contacts")
    gone = uid_of(program.cards("Contacts"), "Una Lee")
    uid = uid_of(program.cards("Contacts"), "Ann Lee")
    person.run("books", "off")
    program.change("Contacts", gone, "NICKNAME:Uni")
    program.change("Contacts", uid, "NICKNAME:Annie")
    person.run("edit", "Ann Lee", "--note", "meanwhile")
    person.run("delete", "Una Lee", "--yes")
    for waiting in (gone, uid):
        program.remote.script("while (!bookOf(given[0])._uidsToSync.has(given[1])) "
                              "await new Promise(r => Services.tm.dispatchToMainThread(r));", "Contacts", waiting)
    program.stop()
    person.run("books", "on")
    program.start()
    program.sync("Contacts")
    shown = person.run("show", "Ann Lee")
    check("Annie" in shown and "meanwhile" in shown, "what was changed there and here meanwhile is both here")
    program.sync("Contacts")
    card = program.cards("Contacts")[uid]
    check("NICKNAME:Annie" in card and "NOTE:meanwhile" in card, "and there")
    check(person.json("list", "Una Lee") == [] and gone not in program.cards("Contacts"),
          "whom somebody deleted here meanwhile does not come back, and goes there")


def of_group(person, program, check):
    program.add("Friends", "BEGIN:VCARD\r\nVERSION:4.0\r\nN:Day;Dora;;;\r\nFN:Dora Day\r\nEND:VCARD\r\n")
    check("Dora Day" in person.run("list", "--group", "Friends"), "who is added to the group's book joins the group")
    program.delete("Friends", uid_of(program.cards("Friends"), "Ann Lee"))
    wait(lambda: "Ann Lee" not in person.run("list", "--group", "Friends"), "a deletion in the group's book")
    check(person.json("list", "Ann Lee"), "who is deleted there leaves the group and stays a contact")
    program.sync("Contacts")
    uid_of(program.cards("Contacts"), "Dora Day")


def forgotten(person, program, check):
    """A token that the books know no more, as after a new database: Thunderbird takes everything anew."""
    program.remote.script("bookOf(given[0])._syncToken = 'urn:rolvane:no-such-token';", "Contacts")
    person.run("add", "--first", "Later", "--last", "Lee")
    program.sync("Contacts")
    check(any("Later Lee" in card for card in program.cards("Contacts").values()),
          "a token that is known no more makes Thunderbird read everything anew")
