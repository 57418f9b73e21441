"""The books of two people, read and written by CardDAV clients: what one puts into the owner's book is in the subscriber's,
and back where writing is allowed. Nobody asks for a pass here: the writer's daemon sends what the client has put, the store
tells the reader's daemon of news, and that one fetches them."""

import re
import statistics
import time

from steps import check, say, summary
from storeview import StoreView
from world import Failure, wait_until

SECONDS = 3  # from the client's request to the other client's book, in the middle of all rounds
PATIENCE = 60  # for a single one, on a machine with other work
ROUNDS = 7


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


def arrives(view, book, word, before, began):
    """Waits for a card with the word among those that are new or changed; its path and the seconds since then."""
    found = []

    def there():
        for path, tag in listing(view, book).items():
            if before.get(path) == tag:
                continue
            status, body = view.request("GET", path)
            if status == 200 and word in body.decode():
                found.append((path, time.monotonic() - began))
                return True, ""
        return False, f"no card of {book} has {word}"
    wait_until(there, PATIENCE, f"{word} in {book}")
    return found[0]


def plot(title, delays):
    for number, delay in enumerate(delays, 1):
        say(f"{title} {number}  {'#' * min(60, max(1, round(delay * 20))):<60} {delay:.2f} s")
    summary.append((f"  {title}: median of {len(delays)}", statistics.median(delays), "ok"))
    summary.append((f"  {title}: the longest", max(delays), "ok"))


class Books:
    """Both people's books, and a card in them."""

    def __init__(self, world, owner, subscriber):
        self.mine, self.theirs = books_of(world, owner), books_of(world, subscriber)
        _, home = self.theirs.request("PROPFIND", self.theirs.base + "/", {"Depth": "1"})
        shared = re.search(r"/books/home/(shared-[^/<]+)/", home.decode())
        check(shared, f"{subscriber.name}'s books have {owner.name}'s contacts as one of their own")
        self.shared = shared.group(1)

    def there(self, number):
        """A client puts a new card into the owner's book; its path in the subscriber's, and how long it took."""
        path, word = f"{self.mine.base}/contacts/client-{number}.vcf", f"there-{number}@example.org"
        before = listing(self.theirs, self.shared)
        card = (f"BEGIN:VCARD\r\nVERSION:3.0\r\nUID:client-{number}\r\nFN:Client {number}\r\nN:{number};Client;;;\r\n"
                f"EMAIL;TYPE=HOME:{word}\r\nEND:VCARD\r\n")
        began = time.monotonic()
        status, _ = self.mine.request("PUT", path, {"If-None-Match": "*", "Content-Type": "text/vcard"}, card.encode())
        check_status(status, (201, 204), f"PUT of {path}")
        return arrives(self.theirs, self.shared, word, before, began)

    def back(self, number, copy):
        """A client of the subscriber's adds an address to the copy; how long it took to the owner's book."""
        answer = f"back-{number}@example.org"
        before = listing(self.mine, "contacts")
        _, body = self.theirs.request("GET", copy)
        edited = body.decode().replace("END:VCARD", f"EMAIL;TYPE=WORK:{answer}\r\nEND:VCARD")
        condition = {"If-Match": listing(self.theirs, self.shared)[copy], "Content-Type": "text/vcard"}
        began = time.monotonic()
        status, _ = self.theirs.request("PUT", copy, condition, edited.encode())
        check_status(status, (200, 201, 204), f"PUT of {copy}")
        return arrives(self.mine, "contacts", answer, before, began)[1]

    def clear(self):
        for number in range(ROUNDS + 1):
            self.mine.request("DELETE", f"{self.mine.base}/contacts/client-{number}.vcf")


def with_news(people, news):
    """Starts the daemons anew, so that they hear of news or do not."""
    for person in people:
        person.environment.update({} if news else {"ROLVANE_NEWS": "never"})
        if news:
            person.environment.pop("ROLVANE_NEWS")
        person.run("daemon", "restart")


def client_edits(world, owner, subscriber):
    with_news((owner, subscriber), True)
    books, there, back = Books(world, owner, subscriber), [], []
    # Once before it counts: then each daemon has made its first pass, and its request for news stands.
    books.back(0, books.there(0)[0])
    for number in range(1, ROUNDS + 1):
        copy, took = books.there(number)
        there.append(took)
        back.append(books.back(number, copy))
    plot(f"a client of {owner.name}'s, then {subscriber.name}'s book", there)
    plot(f"a client of {subscriber.name}'s, then {owner.name}'s book", back)
    for way, delays in (("there", there), ("back", back)):
        middle = statistics.median(delays)
        check(middle <= SECONDS, f"{way}: {middle:.2f} s is the median of {len(delays)} edits, no more than {SECONDS} s")
    books.clear()
    for person in (owner, subscriber):
        person.run("books", "off")
    with_news((owner, subscriber), False)
    for person in (owner, subscriber, subscriber):
        person.run("sync", may=(0, 1, 6))
