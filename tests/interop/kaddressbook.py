"""The books in KAddressBook: its windows on a screen of their own (Xvfb), set up as docs/books.md says, with a contact made,
changed and deleted there. Its books are kept in step by a service of its own (Akonadi)."""

import os
import sys
import tempfile
import time

from world import Failure

PICTURES = os.path.join(os.path.dirname(os.path.dirname(os.path.dirname(os.path.abspath(__file__)))), "docs/pictures")
PATIENCE = 150  # seconds; it looks for changes once a minute


def eventually(test, what):
    end = time.monotonic() + PATIENCE
    while not test():
        if time.monotonic() > end:
            raise Failure(f"{what}: not after {PATIENCE} seconds")
        time.sleep(0.5)


def kaddressbook(person, check):
    sys.path.insert(0, PICTURES)
    from in_kaddressbook import opened, titled, walk

    person.run("add", "--first", "Own", "--last", "Contact", "--phone", "home:555 0100")
    person.run("books", "off")  # it starts again with an access log, by which the windows are followed
    with opened(person) as screen, tempfile.TemporaryDirectory() as pictures:
        walk(person, screen, pictures, "contacts")
        check(True, "KAddressBook is set up as the page says, and asks for the cards of the own contacts")
        screen.key("ctrl+n")
        titled(screen, "^New Contact")
        screen.click(570, 118)  # Add to
        screen.key("Down", "Down", "Return")  # the book, behind the personal contacts and the name given to all of them
        screen.click(450, 210)  # Name
        screen.write("Kat Writer")
        screen.click(366, 258)  # Phone
        screen.write("555 0177")
        screen.key("alt+o")
        eventually(lambda: "555 0177" in person.run("list", "Kat Writer"), "whom KAddressBook adds")
        check(len(person.json("list", "Kat Writer")) == 1, "whom KAddressBook adds is here, once")
        titled(screen, "^KAddressBook")
        screen.click(330, 165)  # the second contact, Own Contact
        screen.click(248, 38)  # Edit Contact
        titled(screen, "^Edit Contact")
        screen.click(780, 179)  # Nickname
        screen.write("Ownie")
        screen.key("alt+o")
        eventually(lambda: "Ownie" in person.run("show", "Own Contact"), "what KAddressBook changes")
        check("555 0100" in person.run("show", "Own Contact"), "what KAddressBook changes is here, and the rest stays")
        titled(screen, "^KAddressBook")
        screen.click(330, 105)  # Kat Writer
        screen.key("Delete")
        titled(screen, "^Delete Contact")
        screen.key("alt+d")
        eventually(lambda: person.json("list", "Kat Writer") == [], "whom KAddressBook deletes")
        check(len(person.json("list")) == 1, "whom KAddressBook deletes is gone here, and nobody else")
