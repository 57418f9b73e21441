# validate.py FILE: each card of the file that is not valid, one a line. Exit code 1 when there is any.
import sys

import vobject

cards = bad = 0
with open(sys.argv[1], encoding="utf-8", newline="") as file:
    for card in vobject.readComponents(file.read()):
        cards += 1
        try:
            card.validate(raiseException=True)
        except Exception as finding:
            bad += 1
            print(card.contents["fn"][0].value, finding)
print(cards, "cards")
sys.exit(1 if bad or not cards else 0)
