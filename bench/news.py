#!/usr/bin/env python3
"""How long an edit takes from `rolvane edit` to the other person's database when nobody says `sync`, and what a thousand
requests that wait for news cost one httpd.

    bench/news.py build/dev [edits] [waiters]
"""

import base64
import json
import os
import socket
import sqlite3
import ssl
import statistics
import sys
import tempfile
import time

sys.path.insert(0, os.path.dirname(os.path.abspath(__file__)))
from benchworld import Person, Process, World, wait_until  # noqa: E402


def changed_at(path, note, limit):
    """When the database holds the text, asked every five milliseconds."""
    database = sqlite3.connect(f"file:{path}?mode=ro", uri=True)
    end = time.monotonic() + limit
    while time.monotonic() < end:
        found = database.execute("select count(*) from people where instr(properties, ?)", (note.encode(),)).fetchone()
        if found[0]:
            return time.monotonic()
        time.sleep(0.005)
    raise SystemExit(f"{note}: not there after {limit} s")


if __name__ == "__main__":
    print(sys.argv)
