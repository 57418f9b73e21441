"""KAddressBook's windows, from the first one to the shared contacts. Its books are read by a service of its own (Akonadi)."""

import contextlib
import os
import re
import subprocess
import time

from screen import HEIGHT, PATIENCE, WIDTH, Screen

SERVICES = [f"/usr/share/dbus-1/services/{name}.service" for name in (
    "org.freedesktop.Akonadi.Control", "org.kde.kiod5", "org.kde.kpasswdserver", "org.kde.kssld5", "org.kde.kded5")]


def kaddressbook(person, target):
    with opened(person) as screen:
        walk(person, screen, target, "shared-")


@contextlib.contextmanager
def opened(person):
    """A screen for it, and an end to its services."""
    # A person who has used the program before has answered whether passwords are kept in a wallet; here they are not.
    with open(os.path.join(person.environment["XDG_CONFIG_HOME"], "kwalletrc"), "w") as out:
        out.write("[Wallet]\nEnabled=false\nFirst Use=false\n")
    screen = Screen(person, SERVICES)
    screen.environment["QT_QPA_PLATFORM"] = "xcb"
    try:
        yield screen
    finally:
        screen.tool("akonadictl", "stop")  # its processes end behind it, at the latest with their bus
        screen.stop()


def titled(screen, pattern, behind=None):
    """Waits for a window of that title, another one than `behind`. Qt's are not found by xdotool's own search for titles."""
    end = time.monotonic() + PATIENCE
    while time.monotonic() < end:
        for window in screen.tool("xdotool", "search", "--onlyvisible", "--class", ".").decode().split():
            if window != behind and re.search(pattern, screen.tool("xdotool", "getwindowname", window).decode()):
                screen.tool("xdotool", "windowactivate", window)
                screen.settle()
                return window
        time.sleep(0.2)
    return screen.fail(f"no window {pattern}")


def walk(person, screen, target, book):
    """From the first window to the contacts; `book`: how the book begins whose cards have to be asked for."""
    def picture(name):
        screen.picture(os.path.join(target, f"kaddressbook-{name}.png"))

    told = person.json("books", "on", "--access-log")
    password = person.json("books", "device", "add", "notebook")["password"]
    screen.start("kaddressbook", stdout=subprocess.DEVNULL)
    main = titled(screen, "^KAddressBook")
    screen.tool("xdotool", "windowmove", main, "0", "0", "windowsize", main, str(WIDTH - 10), str(HEIGHT - 30))
    screen.settle()
    screen.key("alt+f", "Right", "a")  # File, New, Add Address Book...
    titled(screen, "^Add Address Book")
    picture("1-new")
    screen.key("Down", "Return")  # DAV groupware resource
    titled(screen, "^DAV groupware configuration wizard")
    screen.write("notebook")
    screen.key("Tab")
    screen.write(password)
    screen.key("alt+n", "Tab", "alt+c", "alt+f")  # Next, Configure the resource manually, Finish
    titled(screen, "^DAV Resource Configuration")
    screen.write("Rolvane")
    screen.key("Tab")
    screen.write("1")
    screen.key("alt+a")  # Add
    address = titled(screen, "^akonadi_davgroupware")
    screen.key("alt+c")  # CardDAV
    screen.click(211, 110, address)
    screen.write(told["url"] + "books/")
    picture("2-address")
    screen.tool("xdotool", "windowactivate", address)
    screen.key("alt+f")  # Fetch
    titled(screen, "^Server Authentication")
    picture("3-certificate")
    question = titled(screen, "^Server Authentication")
    screen.key("alt+n")  # Continue
    titled(screen, "^Server Authentication", question)
    screen.key("alt+f")  # Forever
    asked = os.path.join(os.path.dirname(told["errorLog"]), "access.log")
    screen.wait_for_line(asked, r"PROPFIND 207 .*/books/home/", "KAddressBook never asked for the books")
    picture("4-choose")
    screen.tool("xdotool", "windowactivate", address)
    screen.key("alt+o")  # OK
    titled(screen, "^DAV Resource Configuration")
    screen.key("alt+o")
    screen.wait_for_line(asked, rf"REPORT 207 .*/{book}", f"KAddressBook never asked for the cards of {book}")
    titled(screen, "^KAddressBook")
    # The list is wider with its right edge drawn aside.
    screen.tool("xdotool", "mousemove", "258", "395", "mousedown", "1", "mousemove", "300", "395", "mousemove", "480", "395",
                "mouseup", "1")
    screen.settle()
    picture("5-contacts")
