"""Days that are not the best: a connection that rested, and a store that says no to everything."""

import http.server
import os
import ssl
import threading
import time
from urllib.parse import urlsplit

from publishing import check_equal
from steps import PASSWORD, Step, check, say, summary
from storeview import StoreView, normal
from world import wait_until

REST_SECONDS = 65  # longer than the store keeps an idle connection
SENT_SECONDS = 5
UNAIDED_SECONDS = 120


class RefusingStore:
    """A server in the place of the store, with its certificate, that answers every request with 403."""

    def __init__(self, endpoint, authority):
        requests = self.requests = []

        class Refuse(http.server.BaseHTTPRequestHandler):
            protocol_version = "HTTP/1.1"

            def __getattr__(self, name):
                if name.startswith("do_"):
                    return self.refuse
                raise AttributeError(name)

            def refuse(self):
                length = int(self.headers.get("Content-Length", 0))
                self.rfile.read(length)
                requests.append(self.command)
                text = b"The administrator has closed this store for a while.\n"
                self.send_response(403)
                self.send_header("Content-Type", "text/plain")
                self.send_header("Content-Length", str(len(text)))
                self.end_headers()
                self.wfile.write(text)

            def log_message(self, *_):
                pass

        place = urlsplit(endpoint.replace("{user}", "nobody"))
        tls = os.path.dirname(authority)
        context = ssl.SSLContext(ssl.PROTOCOL_TLS_SERVER)
        context.load_cert_chain(os.path.join(tls, "server.pem"), os.path.join(tls, "server.key"))
        self.server = http.server.ThreadingHTTPServer(("127.0.0.1", place.port), Refuse)
        self.server.daemon_threads = True
        self.server.socket = context.wrap_socket(self.server.socket, server_side=True)
        self.thread = threading.Thread(target=self.server.serve_forever)

    def __enter__(self):
        self.thread.start()
        return self

    def __exit__(self, *_):
        self.server.shutdown()
        self.thread.join()
        self.server.server_close()
        return False


def arrived(view, uid, key, value):
    def test():
        return (view.contact(normal(uid)) or {}).get(key) == value, "the store has the version before"
    return test


def rested(person, view):
    chosen = person.json("list")[41]["identifier"]
    before = person.json("daemon", "status")["process"]
    view.connection = None
    say(f"nobody does anything for {REST_SECONDS} seconds")
    time.sleep(REST_SECONDS)
    person.run("edit", chosen, "--nickname", "After a rest")
    began = time.monotonic()
    wait_until(arrived(view, chosen, "Nickname", "After a rest"), SENT_SECONDS, "the edit after the rest")
    delay = time.monotonic() - began
    summary.append(("  an edit after a rest", delay, "ok"))
    check(person.json("daemon", "status")["process"] == before,
          f"the edit is on the store {delay * 1000:.0f} ms after the command, sent by the same daemon")


def refused(person, view, endpoint, authority):
    people = person.json("list")
    edited, deleted = people[43]["identifier"], people[44]["identifier"]
    person.run("store", "stop", "--now")
    with RefusingStore(endpoint, authority) as refusing:
        person.run("edit", edited, "--nickname", "Edited while refused")
        added = [person.run("add", "--first", "Refused", "--last", f"Number {i}").strip().splitlines()[0]
                 for i in range(3)]
        person.run("delete", deleted, "--yes")
        began = time.monotonic()
        done = person.start("sync", stdout=-1, stderr=-1)
        said = "".join(done.communicate(timeout=300))
        for line in said.strip().splitlines():
            say(line)
        check(done.returncode in (5, 6) and "up to date" not in said,
              f"`rolvane sync` says so and ends with {done.returncode}, after {time.monotonic() - began:.1f} s")
        check(len(refusing.requests) > 0, f"{len(refusing.requests)} requests were refused")
        own = {p["identifier"]: p for p in person.json("list", "--full", "--own")}
        kept = all(uid in own for uid in added) and deleted not in own
        check(kept and own[edited]["properties"].get("Nickname") == "Edited while refused",
              "the database holds what was saved: one edit, three new people, one deletion")
        status = person.json("status")
        check(status["published"]["everything"], "the contact list is published still")
    person.run("store", "start", "--access-log")
    view.connection = None
    began = time.monotonic()

    def there():
        stored = [view.contact(normal(uid)) for uid in added]
        edit = (view.contact(normal(edited)) or {}).get("Nickname")
        return all(stored) and edit == "Edited while refused" and view.contact(normal(deleted)) is None, "it still waits"

    wait_until(there, UNAIDED_SECONDS, "what was refused")
    delay = time.monotonic() - began
    summary.append(("  sent by itself", delay, "ok"))
    say(f"✓ after the store let it in again the daemon sent all of it by itself, {delay:.1f} s later")
    person.run("sync")
    check_equal(person, view, "after the refusals")


def adversity(person, endpoint, authority):
    """Needs a published list and a daemon that runs."""
    view = StoreView(endpoint, person.name, PASSWORD, authority)
    view.patience = 20
    with Step(f"An edit after {REST_SECONDS} seconds of rest"):
        rested(person, view)
    with Step("A store that says 403 to everything for a while"):
        refused(person, view, endpoint, authority)
