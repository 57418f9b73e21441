"""The books of two people, read and written by CardDAV clients: what one puts into the owner's book is in the subscriber's,
and back where writing is allowed. The writer's daemon sends by itself; the reader's looks every five minutes, so here
it is asked to (`rolvane sync`), again and again until the card is there."""

import re
import time

from steps import Step, check, say, summary
from storeview import StoreView
from world import Failure, wait_until

SECONDS = 3
ROUNDS = 4


def books_of(world, person):
    """A client of the person's books, with a device's password."""
    told = person.json("books", "on")
    world.at_end(lambda: person.run("books", "off", may=(0, 1)))
    password = person.json("books", "device", "add", "client")["password"]
    return StoreView(told["url"] + "books/home", "client", password, told["caFile"])


def listing(view, book):
    """Entity tags by path."""
    status, body = view.request("PROPFIND", f"{view.base}/{book}/", {"Depth": "1"})
    check_status(status, 207, book)
    found = re.findall(r"<[^>]*href>([^<]*\.vcf)<.*?getetag>([^<]*)<", body.decode(), re.S)
    return {path: tag.replace("&quot;", '"') for path, tag in found}


def check_status(status, wanted, what):
    if status not in (wanted if isinstance(wanted, tuple) else (wanted,)):
        raise Failure(f"{what}: status {status}")


def arrives(reader, view, book, word, before):
    """Waits for a card with the word among those that are new or changed; its path and how long it took."""
    began, found = time.monotonic(), []

    def there():
        reader.run("sync", may=(0, 1, 6))
        for path, tag in listing(view, book).items():
            if before.get(path) == tag:
                continue
            status, body = view.request("GET", path)
            if status == 200 and word in body.decode():
                found.append(path)
                return True, ""
        return False, f"no card of {book} has {word}"
    wait_until(there, SECONDS, f"{word} in {book}")
    return found[0], time.monotonic() - began


def plot(title, delays):
    for number, delay in enumerate(delays, 1):
        say(f"{title} {number}  {'#' * max(1, round(delay * 20)):<60} {delay:.2f} s")
    summary.append((f"  {title}, the longest of {len(delays)}", max(delays), "ok"))


def client_edits(world, owner, subscriber):
    mine, theirs = books_of(world, owner), books_of(world, subscriber)
    _, home = theirs.request("PROPFIND", theirs.base + "/", {"Depth": "1"})
    shared = re.search(r"/books/home/(shared-[^/<]+)/", home.decode())
    check(shared, f"{subscriber.name}'s books have {owner.name}'s contacts as one of their own")
    book, there, back = shared.group(1), [], []
    for number in range(ROUNDS):
        path, word = f"{mine.base}/contacts/client-{number}.vcf", f"there-{number}@example.org"
        before = listing(theirs, book)
        card = (f"BEGIN:VCARD\r\nVERSION:3.0\r\nUID:client-{number}\r\nFN:Client {number}\r\nN:{number};Client;;;\r\n"
                f"EMAIL;TYPE=HOME:{word}\r\nEND:VCARD\r\n")
        status, _ = mine.request("PUT", path, {"If-None-Match": "*", "Content-Type": "text/vcard"}, card.encode())
        check_status(status, (201, 204), f"PUT of {path}")
        copy, took = arrives(subscriber, theirs, book, word, before)
        there.append(took)
        answer = f"back-{number}@example.org"
        before = listing(mine, "contacts")
        _, body = theirs.request("GET", copy)
        edited = body.decode().replace("END:VCARD", f"EMAIL;TYPE=WORK:{answer}\r\nEND:VCARD")
        status, _ = theirs.request("PUT", copy, {"If-Match": listing(theirs, book)[copy], "Content-Type": "text/vcard"},
                                   edited.encode())
        check_status(status, (200, 201, 204), f"PUT of {copy}")
        back.append(arrives(owner, mine, "contacts", answer, before)[1])
    plot(f"a client of {owner.name}'s, then {subscriber.name}'s book", there)
    plot(f"a client of {subscriber.name}'s, then {owner.name}'s book", back)
    check(max(there + back) <= SECONDS, f"each of {len(there + back)} edits arrived within {SECONDS} seconds")
    for number in range(ROUNDS):
        mine.request("DELETE", f"{mine.base}/contacts/client-{number}.vcf")
    for person in (owner, subscriber):
        person.run("books", "off")
        person.run("sync", may=(0, 1, 6))
    subscriber.run("sync", may=(0, 1, 6))
