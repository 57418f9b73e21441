#!/usr/bin/env python3
"""usage: plots.py BUILD DIRECTORY

Draws what the benchmarks have left in BUILD (bench.json, onechange.json, news.json) as pictures in the directory: rate over
size, over round trip and over workers, cost of a change over size, delay of news. What was not measured is left out."""

import json
import math
import os
import sys
from html import escape

WIDTH, HEIGHT, LEFT, RIGHT, TOP, BOTTOM = 760, 400, 70, 190, 50, 55
COLOURS = ["#1b6ca8", "#c8553d", "#4f7a28", "#8a5a9e", "#6b6b6b"]


def number(value):
    return f"{value:,.0f}" if value >= 10 or value == int(value) else f"{value:g}"


class Axis:
    """From values to places on the picture."""

    def __init__(self, values, start, end, logarithmic):
        self.logarithmic, self.start, self.end = logarithmic, start, end
        top = max(values)
        if logarithmic:
            self.low, self.high = math.log10(min(values)), math.log10(top)
            self.marks = sorted(set(values)) if len(set(values)) < 8 else \
                [10 ** n for n in range(math.ceil(self.low), math.floor(self.high) + 1)]
        else:
            step = 10 ** math.floor(math.log10(top))
            step = next(s for s in (step / 5, step / 2, step, step * 2) if top / s <= 6)
            self.low, self.high = 0, step * math.ceil(top / step)
            self.marks = [step * i for i in range(round(self.high / step) + 1)]

    def place(self, value):
        at = (math.log10(value) if self.logarithmic else value) - self.low
        return self.start + (self.end - self.start) * at / ((self.high - self.low) or 1)


def picture(title, across, up, series, logarithmic=(False, False), dots=False):
    """An SVG; series: name -> [(x, y)]."""
    points = [point for line in series.values() for point in line]
    x = Axis([p[0] for p in points], LEFT, WIDTH - RIGHT, logarithmic[0])
    y = Axis([p[1] for p in points], HEIGHT - BOTTOM, TOP, logarithmic[1])
    out = [f'<svg xmlns="http://www.w3.org/2000/svg" viewBox="0 0 {WIDTH} {HEIGHT}" font-family="sans-serif" font-size="13">',
           f'<title>{escape(title)}</title><rect width="{WIDTH}" height="{HEIGHT}" fill="#ffffff"/>',
           f'<text x="{LEFT}" y="26" font-size="16" fill="#222222">{escape(title)}</text>']
    for mark in y.marks:
        at = y.place(mark)
        out.append(f'<path d="M{LEFT} {at:.1f}H{WIDTH - RIGHT}" stroke="#dddddd"/><text x="{LEFT - 8}" y="{at + 4:.1f}" '
                   f'text-anchor="end" fill="#444444">{number(mark)}</text>')
    for mark in x.marks:
        at = x.place(mark)
        out.append(f'<path d="M{at:.1f} {HEIGHT - BOTTOM}v5" stroke="#444444"/><text x="{at:.1f}" y="{HEIGHT - BOTTOM + 20}" '
                   f'text-anchor="middle" fill="#444444">{number(mark)}</text>')
    out.append(f'<path d="M{LEFT} {HEIGHT - BOTTOM}H{WIDTH - RIGHT}" stroke="#444444"/>')
    out.append(f'<text x="{(LEFT + WIDTH - RIGHT) / 2}" y="{HEIGHT - 14}" text-anchor="middle" fill="#222222">{escape(across)}</text>')
    out.append(f'<text transform="translate(16 {(TOP + HEIGHT - BOTTOM) / 2}) rotate(-90)" text-anchor="middle" fill="#222222">'
               f'{escape(up)}</text>')
    ends = sorted((y.place(line[-1][1]), name) for name, line in series.items())
    for i in range(1, len(ends)):  # the names stand beside the ends of their lines, and not on one another
        ends[i] = (max(ends[i][0], ends[i - 1][0] + 16), ends[i][1])
    places = {name: at for at, name in ends}
    for colour, (name, line) in zip(COLOURS, series.items()):
        path = "M" + "L".join(f"{x.place(a):.1f} {y.place(b):.1f}" for a, b in line)
        out.append(f'<path d="{path}" fill="none" stroke="{colour}" stroke-width="2"/>')
        if not dots:
            out += [f'<circle cx="{x.place(a):.1f}" cy="{y.place(b):.1f}" r="4" fill="{colour}"/>' for a, b in line]
        out.append(f'<text x="{WIDTH - RIGHT + 10}" y="{places[name] + 4:.1f}" fill="{colour}">{escape(name)}</text>')
    return "\n".join(out) + "\n</svg>\n"


def rate(row):
    return row["people"] / row["ours"]["wall"]


def raw_rate(row):
    return row["raw"]["files"] / row["raw"]["wall"]


def over_size(bench):
    puts = [row for row in bench.get("publication", []) if row["workers"] == 10]
    gets = [row for row in bench.get("subscription", {}).get("first", []) if not row["round_trip_ms"] and row["protocol"] == "h1"]
    series = {"publish": [(r["people"], rate(r)) for r in puts], "raw PUTs": [(r["people"], raw_rate(r)) for r in puts],
              "subscribe": [(r["people"], rate(r)) for r in gets], "raw GETs": [(r["people"], raw_rate(r)) for r in gets]}
    largest = bench.get("edits", {}).get("100000")
    if largest and series["publish"] and series["publish"][-1][0] < 100000:
        series["publish"].append((100000, 100000 / largest["first"]["wall"]))
    return series


def over_round_trip(bench):
    puts = [row for row in bench.get("publication", []) + bench.get("distance", []) if row["people"] == 1000 and
            row["workers"] in ((10, 0) if row["round_trip_ms"] else (10,))]
    gets = [row for row in bench.get("subscription", {}).get("first", []) if row["people"] == 1000 and row["protocol"] == "h1"]
    series = {}
    for name, rows, of in (("publish", puts, rate), ("raw PUTs", puts, raw_rate), ("subscribe", gets, rate),
                           ("raw GETs", gets, raw_rate)):
        series[name] = sorted((row["round_trip_ms"], of(row)) for row in rows)
    return series


def over_workers(bench):
    series = {}
    for row in bench.get("workers", []):
        series.setdefault(f"publish, {row['round_trip_ms']} ms", []).append((row["workers"], rate(row)))
        series.setdefault(f"raw PUTs, {row['round_trip_ms']} ms", []).append((row["workers"], raw_rate(row)))
    return {name: sorted(line) for name, line in series.items()}


def change_over_size(sizes):
    names = {"edit": "edit", "its reader": "its reader", "nothing, publisher": "nothing new, publisher",
             "nothing, reader": "nothing new, reader"}
    return {shown: sorted((int(count), found[name]["ms"]) for count, found in sizes.items())
            for name, shown in names.items()}


def news_delays(news):
    times = sorted(1000 * t for t in news.get("delays", []))
    return {"edits": [(t, 100 * (i + 1) / len(times)) for i, t in enumerate(times)]} if times else {}


def read(build, name):
    try:
        with open(os.path.join(build, name)) as text:
            return json.load(text)
    except FileNotFoundError:
        return {}


def main(build, directory):
    bench = read(build, "bench.json")
    pictures = {
        "rate-over-size": ("Contacts a second over the size, loopback, 10 connections", "people", "contacts a second",
                           over_size(bench), (True, False)),
        "rate-over-round-trip": ("Contacts a second over the round trip, 1,000 people", "milliseconds there and back",
                                 "contacts a second", over_round_trip(bench), (False, True)),
        "rate-over-workers": ("Contacts a second over the workers", "workers", "contacts a second", over_workers(bench),
                              (False, False)),
        "change-over-size": ("CPU of the daemon for a change, and for none", "people", "milliseconds",
                             change_over_size(read(build, "onechange.json")), (True, True)),
        "delay-of-news": ("From the end of an edit to the other person's database", "milliseconds", "per cent of the edits",
                          news_delays(read(build, "news.json")), (False, False)),
    }
    os.makedirs(directory, exist_ok=True)
    for name, (title, across, up, series, logarithmic) in pictures.items():
        series = {key: line for key, line in series.items() if line}
        if not series:
            print(f"{name}: not measured")
            continue
        with open(os.path.join(directory, f"{name}.svg"), "w") as out:
            out.write(picture(title, across, up, series, logarithmic, dots=name == "delay-of-news"))


if __name__ == "__main__":
    if len(sys.argv) != 3:
        sys.exit(__doc__)
    main(*sys.argv[1:])
