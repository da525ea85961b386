#!/usr/bin/env python3
"""Draws the boot screen's artwork and writes it as src/screen/artwork.cpp.

The pictures are 8-bit indexes into one colour table of 256 entries:

  colour table   768 bytes: red, green, blue for each index. Index 0 is white,
                 1 the screen's grey (191, 191, 191), 255 black; the rest are
                 ramps that the pictures use for their anti-aliased edges.
  logo           128 x 128, stored run-length coded as exactly 686 pairs of
                 (count, index) bytes, counts 1..255.
  failure        128 x 128 plain indexes.
  spinner strip  32 x 576 plain indexes: 18 frames of 32 x 32, one under the
                 other; frame n + 1 is frame n turned by 20 degrees clockwise.

Every picture, and each spinner frame, has the background index 1 in its
corners.

Shapes are drawn from signed distance functions: a pixel's coverage of a
shape is 0.5 minus the distance of its centre from the shape's edge, clamped
to 0..1, which gives smooth edges at the cost of one evaluation per pixel.
The blended colour is then mapped to the nearest entry of the colour table.

The logo has a fixed budget of 686 runs. The fitter recolours the single
edge pixels that cost the least visible change until the picture needs no
more runs than that, then splits long runs until it has exactly 686.

Regenerate (Python 3 standard library only):

  python3 tools/artwork/make_artwork.py            # writes src/screen/artwork.cpp
  python3 tools/artwork/make_artwork.py --preview /tmp/artwork

--preview also writes PNG previews of every picture (enlarged) and of a
mock screen with the logo and the spinner in place. The output is
deterministic: running the script twice gives the same file.
"""

import argparse
import math
import os
import struct
import sys
import zlib

LOGO_SIZE = 128
LOGO_PAIRS = 686
SPINNER_SIZE = 32
SPINNER_FRAMES = 18

WHITE = (255, 255, 255)
BACKGROUND = (191, 191, 191)
BLACK = (0, 0, 0)
# The mark's colour: a charcoal with a trace of blue.
INK = (38, 42, 50)
# The spinner's and the failure picture's darkest grey.
GREY_DARK = (48, 48, 48)

# --- colour table -----------------------------------------------------------


def mix(a, b, t):
    return tuple(x + (y - x) * t for x, y in zip(a, b))


def ramp(a, b, steps):
    """`steps` colours strictly between a and b (b itself included)."""
    return [mix(a, b, k / steps) for k in range(1, steps + 1)]


def build_colour_table():
    entries = [WHITE, BACKGROUND]
    entries += ramp(BACKGROUND, INK, 96)  # edges of the mark on the screen
    entries += ramp(INK, WHITE, 32)[:-1]  # edges between the mark and white
    entries += ramp(BACKGROUND, WHITE, 24)[:-1]  # white on the screen
    # A neutral grey ramp from the screen's grey down to GREY_DARK, for the
    # spinner's fading trail and the failure picture.
    entries += ramp(BACKGROUND, GREY_DARK, 64)
    # The rest: an even grey scale, then black at 255.
    rest = 255 - len(entries)
    entries += [(v, v, v) for v in (round(255 * k / rest) for k in range(rest))]
    entries.append(BLACK)
    table = [tuple(int(round(c)) for c in e) for e in entries]
    assert len(table) == 256, len(table)
    assert table[0] == WHITE and table[1] == BACKGROUND and table[255] == BLACK
    return table


class Palette:
    """Maps blended colours to the nearest table entry."""

    def __init__(self, table):
        self.table = table
        self.cache = {}

    def index(self, colour):
        key = tuple(int(round(c)) for c in colour)
        if key == BACKGROUND:
            return 1  # never one of the ramps' copies of it
        found = self.cache.get(key)
        if found is None:
            best = None
            for i, entry in enumerate(self.table):
                d = sum((x - y) ** 2 for x, y in zip(key, entry))
                if best is None or d < best[0]:
                    best = (d, i)
            found = self.cache[key] = best[1]
        return found


# --- signed distance shapes ---------------------------------------------------
# Each shape is a function (x, y) -> distance from its edge, negative inside.


def circle(cx, cy, r):
    return lambda x, y: math.hypot(x - cx, y - cy) - r


def ring(cx, cy, r, half_width):
    return lambda x, y: abs(math.hypot(x - cx, y - cy) - r) - half_width


def rounded_box(cx, cy, half_w, half_h, radius):
    def sd(x, y):
        qx = abs(x - cx) - (half_w - radius)
        qy = abs(y - cy) - (half_h - radius)
        outside = math.hypot(max(qx, 0.0), max(qy, 0.0))
        return outside + min(max(qx, qy), 0.0) - radius

    return sd


def capsule(ax, ay, bx, by, r):
    dx, dy = bx - ax, by - ay
    length2 = dx * dx + dy * dy

    def sd(x, y):
        t = max(0.0, min(1.0, ((x - ax) * dx + (y - ay) * dy) / length2))
        return math.hypot(x - ax - t * dx, y - ay - t * dy) - r

    return sd


def below(y0):
    """The half plane under the line y = y0."""
    return lambda x, y: y0 - y


def above(y0):
    return lambda x, y: y - y0


def union(*shapes):
    return lambda x, y: min(s(x, y) for s in shapes)


def intersect(*shapes):
    return lambda x, y: max(s(x, y) for s in shapes)


def subtract(a, b):
    return lambda x, y: max(a(x, y), -b(x, y))


def coverage(shape, x, y):
    return max(0.0, min(1.0, 0.5 - shape(x + 0.5, y + 0.5)))


def render(width, height, layers, palette):
    """Paints (shape, colour) layers in order over the background."""
    out = []
    for y in range(height):
        for x in range(width):
            colour = BACKGROUND
            for shape, paint in layers:
                a = coverage(shape, x, y)
                if a > 0:
                    colour = mix(colour, paint, a)
            out.append(palette.index(colour))
    return out


# --- the pictures -------------------------------------------------------------


def logo_layers():
    """The mark: a sun rising behind a horizon, under an arc of light.

    A half disc stands on a horizon bar, with a half ring around it, open at
    the bottom. Under the horizon two shorter bars, its reflection, narrow to
    the middle. The pieces are kept apart by gaps of the background grey.
    """
    cx = 64.0
    horizon = 70.0
    sun = intersect(circle(cx, horizon, 22.0), above(horizon))
    halo = intersect(ring(cx, horizon, 36.0, 5.5), above(horizon))
    mark = union(
        sun,
        halo,
        rounded_box(cx, horizon + 6.0, 50.0, 3.0, 3.0),
        rounded_box(cx, horizon + 17.0, 34.0, 3.0, 3.0),
        rounded_box(cx, horizon + 28.0, 18.0, 3.0, 3.0),
    )
    # The sun's body is white inside its dark rim, so that it shines.
    core = intersect(circle(cx, horizon, 16.5), above(horizon))
    return [(mark, INK), (core, WHITE)]


def failure_layers():
    """A ring crossed by a slash: this cannot go on."""
    c, r, half = 64.0, 46.0, 6.5
    d = r / math.sqrt(2)
    slash = intersect(capsule(c - d, c - d, c + d, c + d, half), circle(c, c, r))
    sign = union(ring(c, c, r, half), slash)
    return [(sign, GREY_DARK)]


def spinner_frame(frame, palette):
    """A ring with a comet turning clockwise: a dark head and a tail that
    fades out over 270 degrees, on a faint track."""
    c = SPINNER_SIZE / 2.0
    r, half = 11.0, 2.4
    head = -math.pi / 2 + frame * 2 * math.pi / SPINNER_FRAMES  # 12 o'clock at frame 0
    tail = 1.5 * math.pi
    track = ring(c, c, r, half)
    cap = circle(c + r * math.cos(head), c + r * math.sin(head), half)
    out = []
    for y in range(SPINNER_SIZE):
        for x in range(SPINNER_SIZE):
            px, py = x + 0.5, y + 0.5
            colour = BACKGROUND
            a = coverage(track, x, y)
            if a > 0:
                colour = mix(colour, GREY_DARK, 0.12 * a)
                # How far behind the head, going back counter-clockwise.
                behind = (head - math.atan2(py - c, px - c)) % (2 * math.pi)
                if behind < tail:
                    colour = mix(colour, GREY_DARK, a * (1 - behind / tail) ** 1.6)
            a = coverage(cap, x, y)
            if a > 0:
                colour = mix(colour, GREY_DARK, a)
            out.append(palette.index(colour))
    return out


# --- run-length fitting -----------------------------------------------------------


def runs_of(pixels):
    runs = []
    for p in pixels:
        if runs and runs[-1][1] == p:
            runs[-1][0] += 1
        else:
            runs.append([1, p])
    return runs


def pairs_needed(runs):
    return sum((count + 254) // 255 for count, _ in runs)


def fit_runs(pixels, table, budget):
    """Exactly `budget` (count, index) pairs that expand to `pixels`, or to
    `pixels` with as little visible change as needed to fit."""
    pixels = list(pixels)

    def distance(i, j):
        return sum((a - b) ** 2 for a, b in zip(table[i], table[j]))

    while True:
        runs = runs_of(pixels)
        if pairs_needed(runs) <= budget:
            break
        # Recolour the single pixel between two runs that changes the least;
        # taking its neighbour's index removes one run, or two when both
        # neighbours agree.
        best = None
        position = 0
        for k, (count, index) in enumerate(runs):
            if count == 1 and 0 < k < len(runs) - 1:
                for n in (runs[k - 1][1], runs[k + 1][1]):
                    saving = 2 if runs[k - 1][1] == runs[k + 1][1] else 1
                    cost = distance(index, n) / saving
                    if best is None or cost < best[0]:
                        best = (cost, position, n)
            position += count
        if best is None:
            sys.exit("the logo cannot be fitted to %d runs" % budget)
        pixels[best[1]] = best[2]

    pairs = []
    for count, index in runs:
        while count > 255:
            pairs.append([255, index])
            count -= 255
        pairs.append([count, index])
    # Split the longest runs until the count is exact; the picture stays.
    while len(pairs) < budget:
        k = max(range(len(pairs)), key=lambda i: pairs[i][0])
        count, index = pairs[k]
        if count < 2:
            sys.exit("the logo has too few pixels for %d runs" % budget)
        pairs[k:k + 1] = [[count // 2, index], [count - count // 2, index]]
    assert len(pairs) == budget
    return [tuple(p) for p in pairs], pixels


def expand(pairs):
    out = []
    for count, index in pairs:
        assert 1 <= count <= 255
        out += [index] * count
    return out


def check_corners(pixels, width, height, what):
    for x, y in ((0, 0), (width - 1, 0), (0, height - 1), (width - 1, height - 1)):
        if pixels[y * width + x] != 1:
            sys.exit("%s: corner (%d, %d) is not the background" % (what, x, y))


# --- output ---------------------------------------------------------------------------


def c_array(name, data, comment, per_line=24):
    lines = ["// %s" % comment, "const UINT8 %s[%d] = {" % (name, len(data))]
    for i in range(0, len(data), per_line):
        lines.append("    " + ",".join("%3d" % v for v in data[i:i + per_line]) + ",")
    lines.append("};")
    return "\n".join(lines)


def write_source(path, table, pairs, failure, strip):
    flat_table = [c for entry in table for c in entry]
    flat_pairs = [b for pair in pairs for b in pair]
    parts = [
        "// Generated by tools/artwork/make_artwork.py: edit the script and run it",
        "// again rather than editing this file.",
        '#include "screen/artwork.h"',
        "",
        "namespace nimb {",
        "",
        "// clang-format off",
        c_array("kBootColorTable", flat_table, "Red, green, blue for each of the 256 indexes."),
        "",
        c_array("kLogoRuns", flat_pairs, "The logo, 128 x 128: (count, index) pairs.", per_line=26),
        "",
        c_array("kFailurePicture", failure, "The failure picture, 128 x 128."),
        "",
        c_array("kSpinnerStrip", strip, "The spinner: 18 frames of 32 x 32, one under the other."),
        "// clang-format on",
        "",
        "}  // namespace nimb",
        "",
    ]
    text = "\n".join(parts)
    with open(path, "w") as f:
        f.write(text)


def write_png(path, width, height, rgb_rows):
    raw = b"".join(b"\x00" + bytes(row) for row in rgb_rows)

    def chunk(kind, data):
        body = kind + data
        return struct.pack(">I", len(data)) + body + struct.pack(">I", zlib.crc32(body) & 0xFFFFFFFF)

    png = b"\x89PNG\r\n\x1a\n"
    png += chunk(b"IHDR", struct.pack(">IIBBBBB", width, height, 8, 2, 0, 0, 0))
    png += chunk(b"IDAT", zlib.compress(raw, 9))
    png += chunk(b"IEND", b"")
    with open(path, "wb") as f:
        f.write(png)


def png_of(path, pixels, width, height, table, scale):
    rows = []
    for y in range(height):
        row = []
        for x in range(width):
            row += list(table[pixels[y * width + x]]) * scale
        for _ in range(scale):
            rows.append(row)
    write_png(path, width * scale, height * scale, rows)


def write_previews(directory, table, logo, failure, frames):
    os.makedirs(directory, exist_ok=True)
    png_of(os.path.join(directory, "logo.png"), logo, LOGO_SIZE, LOGO_SIZE, table, 4)
    png_of(os.path.join(directory, "failure.png"), failure, LOGO_SIZE, LOGO_SIZE, table, 4)
    # The spinner's frames in a grid of 6 x 3, in turning order.
    columns, scale = 6, 6
    grid_w, grid_h = columns * SPINNER_SIZE, (SPINNER_FRAMES // columns) * SPINNER_SIZE
    grid = [1] * (grid_w * grid_h)
    for n, frame in enumerate(frames):
        ox, oy = (n % columns) * SPINNER_SIZE, (n // columns) * SPINNER_SIZE
        for y in range(SPINNER_SIZE):
            for x in range(SPINNER_SIZE):
                grid[(oy + y) * grid_w + ox + x] = frame[y * SPINNER_SIZE + x]
    png_of(os.path.join(directory, "spinner.png"), grid, grid_w, grid_h, table, scale)
    # A mock screen of 800 x 600 with the logo and the spinner's frame 0
    # where the loader puts them, and one with the failure picture.
    w, h = 800, 600
    for name, picture, spinner in (("screen.png", logo, frames[0]), ("screen_failed.png", failure, None)):
        screen = [1] * (w * h)
        lx, ly = (w - LOGO_SIZE) >> 1, (h - LOGO_SIZE) >> 1
        for y in range(LOGO_SIZE):
            screen[(ly + y) * w + lx:(ly + y) * w + lx + LOGO_SIZE] = picture[y * LOGO_SIZE:(y + 1) * LOGO_SIZE]
        if spinner is not None:
            sx, sy = (w - SPINNER_SIZE) >> 1, ((h - SPINNER_SIZE) >> 1) + 200
            for y in range(SPINNER_SIZE):
                row = spinner[y * SPINNER_SIZE:(y + 1) * SPINNER_SIZE]
                screen[(sy + y) * w + sx:(sy + y) * w + sx + SPINNER_SIZE] = row
        png_of(os.path.join(directory, name), screen, w, h, table, 1)


def main():
    here = os.path.dirname(os.path.abspath(__file__))
    default_out = os.path.normpath(os.path.join(here, "..", "..", "src", "screen", "artwork.cpp"))
    parser = argparse.ArgumentParser(description=__doc__.split("\n")[0])
    parser.add_argument("--output", default=default_out, help="the C++ file to write")
    parser.add_argument("--preview", metavar="DIR", help="also write PNG previews to DIR")
    args = parser.parse_args()

    table = build_colour_table()
    palette = Palette(table)

    drawn = render(LOGO_SIZE, LOGO_SIZE, logo_layers(), palette)
    natural = pairs_needed(runs_of(drawn))
    pairs, logo = fit_runs(drawn, table, LOGO_PAIRS)
    assert expand(pairs) == logo and len(logo) == LOGO_SIZE * LOGO_SIZE
    changed = sum(1 for a, b in zip(drawn, logo) if a != b)

    failure = render(LOGO_SIZE, LOGO_SIZE, failure_layers(), palette)
    frames = [spinner_frame(n, palette) for n in range(SPINNER_FRAMES)]
    strip = [i for frame in frames for i in frame]

    check_corners(logo, LOGO_SIZE, LOGO_SIZE, "logo")
    check_corners(failure, LOGO_SIZE, LOGO_SIZE, "failure picture")
    for n, frame in enumerate(frames):
        check_corners(frame, SPINNER_SIZE, SPINNER_SIZE, "spinner frame %d" % n)
    assert len(strip) == 18432 and len(failure) == 16384

    write_source(args.output, table, pairs, failure, strip)
    print("%s: logo drawn with %d runs, %d pixels recoloured to fit %d" %
          (args.output, natural, changed, LOGO_PAIRS))
    if args.preview:
        write_previews(args.preview, table, logo, failure, frames)
        print("previews in %s" % args.preview)


if __name__ == "__main__":
    main()
