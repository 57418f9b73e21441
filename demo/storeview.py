"""A reader of a published tree that shares no code with the daemon: plain HTTPS, its own parsers, its own rules."""

import base64
import datetime
import gzip
import hashlib
import http.client
import plistlib
import ssl
import urllib.parse
import xml.etree.ElementTree as ElementTree
from xml.parsers.expat import ExpatError

DAV = "{DAV:}"


class Unreadable(AssertionError):
    """The store did not give what was asked for."""


class StoreView:
    def __init__(self, endpoint, user, password, authority):
        url = urllib.parse.urlsplit(endpoint.replace("{user}", urllib.parse.quote(user)))
        self.host, self.port, self.base = url.hostname, url.port, url.path.rstrip("/")
        self.context = ssl.create_default_context(cafile=authority)
        self.authorization = "Basic " + base64.b64encode(f"{user}:{password}".encode()).decode()
        self.connection = None
        self.requests = 0
        self.patience = 20  # seconds for one answer; httpd may owe the rest of a file that goes while it is sent

    def request(self, method, path, headers=None, body=None):
        """(status, body); the connection is kept and made again when the server closed it."""
        for attempt in (1, 2):
            if self.connection is None:
                self.connection = http.client.HTTPSConnection(self.host, self.port, context=self.context, timeout=self.patience)
            try:
                self.connection.request(method, path, body, {"Authorization": self.authorization, **(headers or {})})
                answer = self.connection.getresponse()
                said = answer.read()
                if said and answer.getheader("Content-Encoding") == "gzip":
                    said = gzip.decompress(said)
                self.requests += 1
                return answer.status, said
            except (http.client.HTTPException, ConnectionError, OSError):
                self.connection.close()
                self.connection = None
                if attempt == 2:
                    raise

    def path(self, *parts):
        return "/".join([self.base] + [urllib.parse.quote(part, safe="") for part in parts])

    def plist(self, *parts):
        """The dictionary in a file, or None when there is no such file."""
        status, body = self.request("GET", self.path(*parts))
        if status == 404:
            return None
        if status != 200:  # 403 is also what httpd says of a file that goes while it is being opened
            raise Unreadable(f"GET {'/'.join(parts)}: status {status}")
        try:
            return plistlib.loads(body, fmt=plistlib.FMT_XML)
        except (plistlib.InvalidFileException, ExpatError) as error:
            # So does httpd answer for a moment when a file is replaced by a longer one: with as much as it was long.
            raise Unreadable(f"GET {'/'.join(parts)}: {len(body)} bytes are no property list: {error}")

    def names(self, *parts):
        """(files, directories) in a directory."""
        # Some servers fail over what nobody needs: the kind of each member is all that is asked for.
        status, body = self.request("PROPFIND", self.path(*parts) + "/", {"Depth": "1", "Content-Type": "application/xml"},
                                    '<propfind xmlns="DAV:"><prop><resourcetype/></prop></propfind>')
        if status != 207:
            raise AssertionError(f"PROPFIND {'/'.join(parts)}: status {status}")
        files, directories = set(), set()
        own = urllib.parse.unquote(self.path(*parts)).rstrip("/")
        for response in ElementTree.fromstring(body).findall(f"{DAV}response"):
            path = urllib.parse.unquote(urllib.parse.urlsplit(response.find(f"{DAV}href").text).path).rstrip("/")
            if path == own:
                continue
            kind = directories if response.find(f".//{DAV}collection") is not None else files
            kind.add(path[len(own) + 1:])
        return files, directories

    @staticmethod
    def bucket(uid):
        return str(hashlib.md5(uid.encode()).digest()[0] & 31)

    def contact(self, uid):
        return self.plist("People", self.bucket(uid), uid)


def as_json(value):
    """A property list's value in the form in which the contact application prints it."""
    if isinstance(value, bytes):
        return base64.b64encode(value).decode()
    if isinstance(value, datetime.datetime):
        return value.strftime("%Y-%m-%dT%H:%M:%SZ")
    if isinstance(value, dict):
        return {key: as_json(item) for key, item in value.items()}
    if isinstance(value, list):
        return [as_json(item) for item in value]
    return value


def normal(uid):
    """An identifier as it stands on a store."""
    uuid, _, table = uid.partition(":")
    return f"{uuid}:{'CXGroup' if 'Group' in table else 'CXPerson'}" if table else uid


def differences(view, people, groups):
    """Compares the whole tree with the database, as the application printed it; a list of sentences, empty when equal."""
    found = []
    expected = {normal(person["identifier"]): person for person in people}

    buckets = view.names("People")[1]
    if buckets != {str(i) for i in range(32)}:
        found.append(f"the buckets are {sorted(buckets)}")
    seen = {}
    for bucket in sorted(buckets, key=int):
        for uid in view.names("People", bucket)[0]:
            if view.bucket(uid) != bucket:
                found.append(f"{uid} lies in bucket {bucket}, not in {view.bucket(uid)}")
            seen[uid] = bucket
    for uid in sorted(seen.keys() - expected.keys()):
        found.append(f"{uid} is on the store but not in the database")
    for uid, person in expected.items():
        if uid not in seen:
            found.append(f"{person['name']} ({uid}) is not on the store")
            continue
        stored = as_json(view.contact(uid))
        if stored != person["properties"]:
            keys = [key for key in sorted({*stored, *person["properties"]})
                    if stored.get(key) != person["properties"].get(key)]
            found.append(f"{person['name']} ({uid}) differs in {', '.join(keys)}")

    files, directories = view.names()
    names = {name for name in files | directories if name.endswith("CXGroup")}
    wanted = {normal(group["identifier"]): group for group in groups}
    for uid in sorted(names - wanted.keys() - {"AllCXGroup"}):
        found.append(f"the group {uid} is on the store but not in the database")
    for uid, group in wanted.items():
        found += group_differences(view.plist(uid), group)

    everybody = view.plist("AllCXGroup") or {}
    members = everybody.get("memberUIDState", [])
    if len(members) != len(set(members)):
        found.append("somebody is listed twice in the list of everybody")
    if set(members) != set(expected):
        found.append(f"the list of everybody has {len(set(members) - set(expected))} too many and "
                     f"{len(set(expected) - set(members))} too few")
    if sorted(everybody.get("subgroupUIDState", [])) != sorted(wanted):
        found.append("the list of groups differs")
    for name in ("info", "dateFile"):
        if name not in files:
            found.append(f"the file {name} is missing")
    return found


def group_differences(state, group):
    if state is None:
        return [f"the group {group['name']} is not on the store"]
    found = []
    if state.get("GroupName") != group["name"]:
        found.append(f"the group {group['name']} is called {state.get('GroupName')!r} on the store")
    for key, mine in (("memberUIDState", group["members"]), ("subgroupUIDState", group["subgroups"])):
        theirs = state.get(key, [])
        if len(theirs) != len(set(theirs)):
            found.append(f"the group {group['name']} lists something twice in {key}")
        if sorted(theirs) != sorted(normal(uid) for uid in mine):
            found.append(f"the group {group['name']} differs in {key}")
    chosen = {person: choice for person, choice in state.get("distributionListState", {}).items() if choice}
    mine = {normal(person): choice for person, choice in group["distribution"].items()}
    if as_json(chosen) != mine:
        found.append(f"the group {group['name']} differs in its distribution choices")
    return found
