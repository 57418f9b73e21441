"""A program that wants a terminal, typed to as a person would: each answer waits for its prompt."""

import os
import pty
import re
import select
import time


def converse(arguments, environment, answers, seconds=30):
    """Runs the program on a terminal of its own. `answers` is a list of (prompt pattern, line to type); the program's
    whole output is the result."""
    process, terminal = pty.fork()
    if process == 0:
        os.execvpe(arguments[0], arguments, {**environment, "TERM": "dumb"})
    output, seen, end = "", 0, time.monotonic() + seconds
    waiting = list(answers)
    while time.monotonic() < end:
        if waiting:
            prompt = re.compile(waiting[0][0]).search(output, seen)
            if prompt:
                seen = prompt.end()
                os.write(terminal, waiting.pop(0)[1].encode() + b"\n")
                continue
        if not select.select([terminal], [], [], 0.2)[0]:
            continue
        try:
            more = os.read(terminal, 65536)
        except OSError:  # the program has closed the terminal
            break
        if not more:
            break
        output += more.decode(errors="replace")
    os.close(terminal)
    os.waitpid(process, 0)
    return output
