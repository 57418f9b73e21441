"""Thunderbird's windows, from its address book to the shared contacts. What a person clicks is clicked; only whether the
cards have come is asked of the program itself."""

import os

from screen import Screen
from thunderbird import PREFERENCES, Thunderbird

# A person has a mail account already, and has seen the notices of a new installation.
SEEN = {"mail.provider.suppress_dialog_on_startup": True, "mail.rights.version": 1, "remote.prefs.recommended": False}
ADDRESS_BOOK, NEW_BOOK, USER, ADDRESS, PASSWORD, CONTINUE = (22, 87), (69, 127), (545, 301), (545, 400), (545, 405), (844, 578)
CONFIRM, SHARED_BOOK, FIRST_CARD = (421, 528), (110, 235), (450, 180)


def thunderbird(person, target):
    told = person.json("books", "on", "--access-log")
    password = person.json("books", "device", "add", "desktop")["password"]
    PREFERENCES.update(SEEN)
    screen = Screen(person)
    program = Thunderbird(person, screen.environment["DISPLAY"])
    try:
        program.start()
        walk(screen, program, told, password, target)
    finally:
        program.stop()
        screen.stop()


def walk(screen, program, told, password, target):
    def picture(name):
        screen.picture(os.path.join(target, f"thunderbird-{name}.png"))

    screen.window("Mozilla Thunderbird")
    program.remote.script("const w = Services.wm.getMostRecentWindow('mail:3pane'); w.moveTo(0, 0); w.resizeTo(1090, 740);")
    screen.settle()
    screen.click(*ADDRESS_BOOK)
    screen.click(*NEW_BOOK)
    picture("1-new")
    screen.key("Return")  # Add remote Address Book, which has the focus
    screen.click(*USER)
    screen.write("desktop")
    screen.click(*ADDRESS)
    screen.write(told["url"])
    picture("2-address")
    screen.click(*CONTINUE)
    screen.click(*PASSWORD)
    screen.write(password)
    screen.click(*CONTINUE)
    screen.window("^Add Security Exception")
    picture("3-certificate")
    screen.click(*CONFIRM)
    picture("4-choose")
    screen.click(*CONTINUE)
    screen.wait_for_line(os.path.join(os.path.dirname(told["errorLog"]), "access.log"), r"REPORT 207 .*/shared-",
                         "Thunderbird never asked for the shared cards")
    screen.click(*SHARED_BOOK)
    screen.click(*FIRST_CARD)
    picture("5-contacts")
