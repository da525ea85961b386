#!/usr/bin/env python3
"""Boots the EFI programs under QEMU and OVMF and checks what they print.

Each scenario (scenarios.py) describes an EFI system partition: the platform
layer, the loader, the platform's configuration file and any other files,
such as the reference kernel of tests/guest/, driver bundles, exact times
and a kernel cache that kcache writes. The harness stages them, has the disk
tool (tools/mkdisk) make a GPT disk image of them or serves them over TFTP,
boots them with tools/qemuboot, and checks the serial log, the exit code
that the platform layer or the kernel leaves through the debug-exit device,
the kernel's report and, when the scenario asks, screenshots; a machine
without serial port and debug-exit device is read from the text on its
screen.

    harness.py --efi-dir build/efi --scenario no_kernel    one scenario
    harness.py --efi-dir build/efi                          all scenarios
    harness.py --list                                        names only
    harness.py --demo [--net]                                boot the kernel, screenshot into out/
"""

import argparse
import collections
import dataclasses
import os
import re
import shutil
import signal
import struct
import subprocess
import sys
import tempfile
import time
import zlib
from pathlib import Path

REPO = Path(__file__).resolve().parents[2]
sys.path.insert(0, str(Path(__file__).resolve().parent))
sys.path.insert(0, str(REPO / "tools" / "qemuboot"))
from qemuboot import NET_ID, Machine, boot, serve_directory  # noqa: E402
from scenarios import (BASE_CONFIG, EXTENSIONS_DIR, RESUME_PARTITION_GUID, GuestFile, KernelCache,  # noqa: E402
                       KernelExpect, NetScenario, SCENARIOS, Scenario, ScreenExpect, kernel_file, mkdisk,
                       net_kernel_files, quoted)

# The exit codes of the platform layer and of the reference kernel: one
# table, no code in both.
EXIT_CODE_HEADERS = (REPO / "platform" / "exitcodes.h", REPO / "tests" / "guest" / "exitcodes.h")
GUEST_DIR = REPO / "build" / "tests" / "guest"
# The host tools (kcache); --tools-dir changes it.
TOOLS_DIR = REPO / "build" / "tools"
ARTWORK = REPO / "src" / "screen" / "artwork.cpp"
DEMO_SCREEN = REPO / "out" / "demo-screen.png"
NET_DEMO_SCREEN = REPO / "out" / "demo-net-screen.png"
DOCS_SCREEN = REPO / "docs" / "demo-screen.png"
RESUME_TOOL = REPO / "tools" / "mkresume" / "mkresume.py"
RESUME_PROBE = "resume_probe.elf"

# The platform's report, on the serial port.
REPORT_STATUS = re.compile(r"platform: loader returned 0x([0-9a-f]+) \((\w+)\)")
REPORT_MEMORY = re.compile(r"platform: memory (same|changed)")
REPORT_CONSOLE_MODE = re.compile(r"platform: console mode (\S+)")


# --- exit codes -----------------------------------------------------------------------


# What a run's exit status says: the name of the code in its header (or a
# word of the harness's own) and, when the loader came back, its status and
# whether the free memory is the "same" or "changed".
Outcome = collections.namedtuple("Outcome", "name status memory", defaults=(None, None))


STATUS_OF_PREFIX = {"Aborted": "EFI_ABORTED", "Success": "EFI_SUCCESS", "Other": "other"}


def read_exit_codes(headers=EXIT_CODE_HEADERS):
    """The kExit... constants of the headers as one table: code -> Outcome; refuses
    a code or name given twice (in one header or across them) and a header without codes."""
    codes = {}
    pattern = re.compile(r"constexpr\s+UINT8\s+kExit(\w+)\s*=\s*(0x[0-9A-Fa-f]+|\d+)\s*;")
    for header in headers:
        found = pattern.findall(Path(header).read_text())
        if not found:
            raise ValueError(f"{header}: no exit codes found")
        for name, code in found:
            code, loader = int(code, 0), re.fullmatch(r"(Aborted|Success|Other)(Same|Changed)", name)
            if code in codes or any(known.name == name for known in codes.values()):
                raise ValueError(f"{header}: code {code:#x} or name {name} given twice")
            codes[code] = Outcome(name, STATUS_OF_PREFIX[loader[1]], loader[2].lower()) if loader else Outcome(name)
    return codes


def decode_exit(returncode, codes):
    """QEMU's exit status as an Outcome: debug-exit's (code << 1) | 1, or 0 for a power-off."""
    if returncode is None:
        return Outcome("Timeout")
    if returncode < 0:
        return Outcome(f"Signal{-returncode}")
    if returncode == 0:
        return Outcome("PoweredOff")
    if returncode & 1 and (returncode >> 1) in codes:
        return codes[returncode >> 1]
    return Outcome(f"QemuExit{returncode}")


# --- the serial log -------------------------------------------------------------------


def check_log(log, expect=(), forbid=()):
    """Problems with `log`: strings of `expect` missing or out of order, any of `forbid` present."""
    problems = []
    position = 0
    for text in expect:
        found = log.find(text, position)
        if found < 0:
            where = "at all" if log.find(text) < 0 else "after the text before it"
            problems.append(f"missing {where}: {text!r}")
        else:
            position = found + len(text)
    return problems + [f"present but forbidden: {text!r}" for text in forbid if text in log]


def check_console_modes(log, wanted):
    """Problems with the console modes the loader asked for against all those `wanted` (None: any)."""
    if wanted is None:
        return []
    asked = REPORT_CONSOLE_MODE.findall(log)
    return [] if asked == list(wanted) else [f"console modes asked for: {asked}, wanted {list(wanted)}"]


def check_report(log, outcome, status, memory, exit_name):
    """Problems with the platform's report and exit code; `exit_name` overrides the outcome
    that status and memory give (for runs where the platform itself fails)."""
    if exit_name is not None:
        return [] if outcome.name == exit_name else [f"exit: wanted {exit_name}, got {outcome.name}"]
    problems = []
    if outcome.status is None:
        problems.append(f"exit: wanted the loader's outcome, got {outcome.name}")
    else:
        if status != "other" and outcome.status != status:
            problems.append(f"exit code says status {outcome.status}, wanted {status}")
        if outcome.memory != memory:
            problems.append(f"exit code says memory {outcome.memory}, wanted {memory}")
    reported = REPORT_STATUS.findall(log)
    if len(reported) != 1:
        problems.append(f"{len(reported)} status reports in the log, wanted one")
    elif status != "other" and reported[0][1] != status:
        problems.append(f"platform reported {reported[0][1]}, wanted {status}")
    memory_reports = REPORT_MEMORY.findall(log)
    if memory_reports != [memory]:
        problems.append(f"memory reports {memory_reports}, wanted [{memory!r}]")
    return problems


# --- the kernel's report --------------------------------------------------------------

KERNEL_LINE = re.compile(r"^kernel: (\w+)(?: (.*))?$", re.M)
KERNEL_CHECK = re.compile(r"(\S+) (ok|FAIL)(?: (.*))?")
KERNEL_RESULT = re.compile(r"(pass|fail) \((\d+) checks?, (\d+) failed\)")
KERNEL_RANGE = re.compile(r"(.+) address=(0x[0-9a-f]+) length=(0x[0-9a-f]+)")
KERNEL_VALUE = re.compile(r"(\S+) (.+) ([0-9a-f]*)")
KERNEL_DRIVER = re.compile(r'(".*") from=(\w+) address=(0x[0-9a-f]+) plist=(0x[0-9a-f]+) code=(0x[0-9a-f]+) sum=(0x[0-9a-f]+)')
TREE_NODE = re.compile(r"( *)([^=]*)/ \((\d+) propert(?:y|ies), (\d+) child(?:ren)?\)")
TREE_PROPERTY = re.compile(r"( *)(\S.*?) = (.*)")
ROOT_UUID_MESSAGE = re.compile(r"root device uuid is '(.*)'")
# Lines of the report that no check reads: the entry registers, the memory
# map, the firmware's tables, the hold and the restart probe's own lines.
UNCHECKED_KINDS = ("entry", "memmap", "efi", "hold", "resume")


KernelCheck = collections.namedtuple("KernelCheck", "name ok detail")


@dataclasses.dataclass
class KernelReport:
    """The kernel's `kernel: ...` lines of a serial log (tests/guest/report.h)."""

    starts: int = 0
    checks: list = dataclasses.field(default_factory=list)  # KernelCheck, in order
    bootargs: dict = dataclasses.field(default_factory=dict)  # field -> number or text
    tree: dict = dataclasses.field(default_factory=dict)  # node path -> {property: value as printed}
    tree_errors: list = dataclasses.field(default_factory=list)
    values: dict = dataclasses.field(default_factory=dict)  # (node path, property) -> whole value, bytes
    ranges: dict = dataclasses.field(default_factory=dict)  # name -> (address, length)
    result: tuple | None = None  # (passed, checks, failed) of the result line
    drivers: list = dataclasses.field(default_factory=list)  # (identifier, from, plist, code, sum), in order
    package: tuple | None = None  # (length, sum) of the driver package
    drivers_from: str | None = None  # "loader", "cache" or "none"
    tsc: dict = dataclasses.field(default_factory=dict)  # moment -> time stamp counter
    unknown: list = dataclasses.field(default_factory=list)  # lines of no known kind

    def failed_checks(self):
        return [check for check in self.checks if not check.ok]


QUOTED = re.compile(r'"((?:[^"\\]|\\["\\]|\\x[0-9a-f]{2})*)"')


def unquote(value):
    """The text of a quoted value of the report, its escapes (\\", \\\\, \\xNN) undone."""
    quoted = QUOTED.fullmatch(value)
    if quoted is None:
        raise ValueError(f"not a quoted text: {value!r}")
    return re.sub(r'\\(["\\]|x[0-9a-f]{2})', lambda m: m[1] if len(m[1]) == 1 else chr(int(m[1][1:], 16)), quoted[1])


def report_value(value):
    """A value of the report: a quoted text, else a C number, else as it stands."""
    if value.startswith('"'):
        return unquote(value)
    try:
        return int(value, 0)
    except ValueError:
        return value


def fields(text):
    """`name=value name=value ...` of numbers."""
    return {name: report_value(value) for name, value in re.findall(r"(\w+)=(\S+)", text)}


def parse_kernel_report(log):
    """The kernel's report in a cleaned serial log."""
    report = KernelReport()
    nodes = []  # the names of the nodes on the way to the current one
    for match in KERNEL_LINE.finditer(log):
        kind, rest = match.group(1), match.group(2) or ""
        if kind == "start":
            report.starts += 1
        elif kind in UNCHECKED_KINDS:
            continue
        elif kind == "check" and KERNEL_CHECK.fullmatch(rest):
            name, ok, detail = KERNEL_CHECK.fullmatch(rest).groups()
            report.checks.append(KernelCheck(name, ok == "ok", detail or ""))
        elif kind == "bootargs" and "=" in rest:
            name, value = rest.split("=", 1)
            report.bootargs[name] = report_value(value)
        elif kind == "tree" and rest.startswith("error "):
            report.tree_errors.append(rest[len("error ") :])
        elif kind == "tree":
            node, prop = TREE_NODE.fullmatch(rest), TREE_PROPERTY.fullmatch(rest)
            if node:
                depth = len(node.group(1)) // 2
                nodes[depth:] = [node.group(2)]
                report.tree.setdefault("/" + "/".join(nodes[1:]), {})
            elif prop:
                path = "/" + "/".join(nodes[1 : len(prop.group(1)) // 2])
                report.tree.setdefault(path, {}).setdefault(prop.group(2), prop.group(3))
            else:
                report.unknown.append(match.group(0))
        elif kind == "value" and KERNEL_VALUE.fullmatch(rest):
            path, name, value = KERNEL_VALUE.fullmatch(rest).groups()
            report.values[(path, name)] = bytes.fromhex(value)
        elif kind == "range" and KERNEL_RANGE.fullmatch(rest):
            name, address, length = KERNEL_RANGE.fullmatch(rest).groups()
            report.ranges[name] = (int(address, 16), int(length, 16))
        elif kind == "result" and KERNEL_RESULT.fullmatch(rest):
            verdict, checks, failed = KERNEL_RESULT.fullmatch(rest).groups()
            report.result = (verdict == "pass", int(checks), int(failed))
        elif kind == "driver" and KERNEL_DRIVER.fullmatch(rest):
            identifier, source, _, plist, code, checksum = KERNEL_DRIVER.fullmatch(rest).groups()
            report.drivers.append((unquote(identifier), source, int(plist, 16), int(code, 16), int(checksum, 16)))
        elif kind == "package":
            numbers = fields(rest)
            report.package = (numbers.get("length"), numbers.get("sum"))
        elif kind == "tsc":
            report.tsc.update(fields(rest))
        elif kind == "drivers":
            report.drivers_from = fields(rest).get("from")
        else:
            report.unknown.append(match.group(0))
    return report


def matches(wanted, value):
    """Whether `value` is as `wanted`: a pattern's full match, a callable's answer, or equality."""
    if isinstance(wanted, re.Pattern):
        return isinstance(value, str) and wanted.fullmatch(value) is not None
    if callable(wanted):
        return wanted(value)
    return value == wanted


def describe(wanted):
    return f"/{wanted.pattern}/" if isinstance(wanted, re.Pattern) else repr(wanted)


def check_drivers(report, expect, guest_dir=GUEST_DIR):
    """Problems with the drivers' source, blocks (identifier, sizes, Adler-32) and package."""
    problems = []
    if expect.drivers_from is not None and report.drivers_from != expect.drivers_from:
        problems.append(f"kernel: drivers from {report.drivers_from}, wanted {expect.drivers_from}")
    if expect.drivers is not None:
        wanted = []
        for identifier, driver in expect.drivers.items():
            code = content_bytes(driver.code, guest_dir)
            wanted.append((identifier, len(content_bytes(driver.plist)) + 1, len(code), zlib.adler32(code)))
        got = [(identifier, plist, code, checksum) for identifier, _, plist, code, checksum in report.drivers]
        if got != wanted:
            show = lambda rows: [f"{i} plist={p:#x} code={c:#x} sum={s:#x}" for i, p, c, s in rows]  # noqa: E731
            problems.append(f"kernel: drivers {show(got)}, wanted {show(wanted)}")
    if expect.package is not None:
        package = content_bytes(expect.package, guest_dir)
        wanted = (len(package), zlib.adler32(package))
        if report.package != wanted:
            problems.append(f"kernel: package (length, sum) {report.package}, wanted {wanted}")
    return problems


def check_kernel(log, expect, guest_dir=GUEST_DIR):
    """Problems with the kernel's report against `expect` (KernelExpect) and what any report must
    hold: one start, a result line that agrees with the checks, no broken tree, the printed "boot-uuid"."""
    report = parse_kernel_report(log)
    if report.starts == 0:
        return ["kernel: no report (no 'kernel: start' line)"]
    problems = []
    if report.starts != 1:
        problems.append(f"kernel: started {report.starts} times")
    failed = report.failed_checks()
    if report.result is None:
        problems.append("kernel: no result line: the report broke off")
    elif report.result[1:] != (len(report.checks), len(failed)) or report.result[0] != (not failed):
        problems.append(f"kernel: result line says {report.result}, the checks {len(report.checks)} of which "
                        f"{len(failed)} failed")
    if expect.result == "pass":
        problems += [f"kernel: check {check.name} FAIL {check.detail}" for check in failed]
        if not report.checks:
            problems.append("kernel: no checks reported")
    elif not failed:
        problems.append("kernel: every check passed, wanted a failure")
    problems += [f"kernel: tree error {error}" for error in report.tree_errors]
    problems += [f"kernel: line of no known kind: {line!r}" for line in report.unknown]

    for name, wanted in expect.bootargs.items():
        if name not in report.bootargs:
            problems.append(f"kernel: bootargs {name} not reported")
        elif not matches(wanted, report.bootargs[name]):
            problems.append(f"kernel: bootargs {name}={report.bootargs[name]!r}, wanted {describe(wanted)}")
    for path, properties in expect.tree.items():
        if path not in report.tree:
            problems.append(f"kernel: tree has no node {path}")
            continue
        for name, wanted in properties.items():
            got = report.tree[path].get(name)
            if got is None:
                problems.append(f"kernel: tree {path} has no property {name}")
            elif not matches(wanted, got):
                problems.append(f"kernel: tree {path} {name} = {got}, wanted {describe(wanted)}")
    for name, length in expect.ranges.items():
        if isinstance(name, re.Pattern):
            found = [known for known in report.ranges if name.fullmatch(known)]
            name = found[0] if len(found) == 1 else describe(name)
        if name not in report.ranges:
            problems.append(f"kernel: no range {name}")
        elif length is not None and report.ranges[name][1] != length:
            problems.append(f"kernel: range {name} length {report.ranges[name][1]:#x}, wanted {length:#x}")

    problems += check_drivers(report, expect, guest_dir)

    printed = ROOT_UUID_MESSAGE.findall(log)
    uuid = report.tree.get("/chosen", {}).get("boot-uuid")
    if printed and uuid != quoted(printed[-1]):
        problems.append(f"kernel: tree /chosen boot-uuid = {uuid}, the loader printed {printed[-1]!r}")
    return problems


# --- the wire -------------------------------------------------------------------------

DHCP_MAGIC = bytes([99, 130, 83, 99])
ROOT_MATCHING = (
    "<dict><key>ZoryaProviderClass</key><string>ZoryaNetworkInterface</string><key>ZoryaParentMatch</key>"
    '<dict><key>ZoryaPropertyMatch</key><dict><key>ZoryaMACAddress</key><data format="hex">{}</data>'
    "</dict></dict></dict>"
)


def read_pcap(data):
    """The frames of a classic pcap file (what QEMU's filter-dump writes)."""
    magic = data[:4]
    order = "<" if magic == b"\xd4\xc3\xb2\xa1" else ">" if magic == b"\xa1\xb2\xc3\xd4" else None
    if order is None:
        raise ValueError("not a pcap file")
    frames, offset = [], 24
    while offset + 16 <= len(data):
        length = struct.unpack(order + "I", data[offset + 8 : offset + 12])[0]
        frames.append(data[offset + 16 : offset + 16 + length])
        offset += 16 + length
    return frames


def dhcp_messages(frames):
    """(the Ethernet source of the client's first DHCP message, the UDP payloads from port 67)."""
    client, answers = None, []
    for frame in frames:
        if frame[12:14] != b"\x08\x00" or len(frame) < 34 or frame[23] != 17:
            continue
        ip = frame[14:]
        header = (ip[0] & 15) * 4
        source, destination, length = struct.unpack(">HHH", ip[header : header + 6])
        payload = ip[header + 8 : header + length]
        if source == 68 and destination == 67 and client is None:
            client = frame[6:12]
        elif source == 67:
            answers.append(payload)
    return client, answers


def dhcp_type(message):
    """The DHCP message type (option 53) of a message, or None."""
    if message[236:240] != DHCP_MAGIC:
        return None
    offset = 240
    while offset + 1 < len(message) and message[offset] != 255:
        if message[offset] == 0:
            offset += 1
            continue
        if message[offset] == 53:
            return message[offset + 2]
        offset += 2 + message[offset + 1]
    return None


def check_capture(log, pcap):
    """Problems with the kernel's network identity against the wire: "dhcp-response" the server's
    DHCP ACK byte for byte (trailing zeros may be left off), "root-matching" the client's MAC."""
    try:
        client, answers = dhcp_messages(read_pcap(Path(pcap).read_bytes()))
    except (OSError, ValueError) as error:
        return [f"capture: {error}"]
    acks = [message for message in answers if dhcp_type(message) == 5]
    if client is None or not acks:
        return ["capture: no DHCP exchange on the wire"]
    report = parse_kernel_report(log)
    problems = []
    wanted = quoted(ROOT_MATCHING.format(client.hex()))
    got = report.tree.get("/chosen", {}).get("root-matching")
    if got != wanted:
        problems.append(f"capture: root-matching {got}, wanted the client's MAC {client.hex()}")
    ack = acks[-1]
    dhcp = report.values.get(("/chosen", "dhcp-response"))
    if dhcp is None:
        problems.append("capture: no whole dhcp-response in the kernel's report")
    elif dhcp != ack[: len(dhcp)] or any(ack[len(dhcp) :]) or len(dhcp) > len(ack):
        first = next((i for i, (a, b) in enumerate(zip(dhcp, ack)) if a != b), min(len(dhcp), len(ack)))
        problems.append(f"capture: dhcp-response of {len(dhcp)} bytes differs from the ACK of {len(ack)} on the "
                        f"wire at byte {first}")
    return problems


# --- the screen -----------------------------------------------------------------------

PICTURE_SIZE = 128  # the logo and the failure picture
SPINNER_SIZE = 32  # a frame of the spinner, centred 200 pixels below the middle
SPINNER_DROP = 200
# Between the two screenshots that show the spinner turning: a few of its
# 100 ms ticks.
SPINNER_GAP = 0.5


@dataclasses.dataclass
class Image:
    """Pixels as rows of bytes, three (red, green, blue) a pixel."""

    width: int
    height: int
    rows: list

    def pixel(self, x, y):
        return tuple(self.rows[y][3 * x : 3 * x + 3])


def read_ppm(data):
    """A binary PPM file of 8-bit samples (QEMU's screendump) as an Image."""
    header = re.match(rb"P6\s+(\d+)\s+(\d+)\s+255\s", data)
    if header is None:
        raise ValueError("not a binary PPM file of 8-bit samples")
    width, height, stride = int(header[1]), int(header[2]), 3 * int(header[1])
    pixels = data[header.end() :]
    if len(pixels) < stride * height:
        raise ValueError(f"PPM data of {len(pixels)} bytes for {width} x {height}")
    return Image(width, height, [pixels[y * stride : (y + 1) * stride] for y in range(height)])


def read_artwork(source=ARTWORK):
    """The loader's pictures as name -> (red, green, blue) tuples, row by row: "logo" and
    "failure" of 128 x 128, "spinner0" to "spinner17" of 32 x 32."""
    text = Path(source).read_text()

    def array(name):
        found = re.search(name + r"\[[^\]]*\]\s*=\s*\{(.*?)\};", text, re.S)
        if not found:
            raise ValueError(f"{source}: no {name}")
        return [int(number, 0) for number in re.findall(r"0x[0-9A-Fa-f]+|\d+", found.group(1))]

    table = array("kBootColorTable")
    runs = array("kLogoRuns")
    logo = [index for count, index in zip(runs[::2], runs[1::2]) for _ in range(count)]
    pictures = {"logo": logo, "failure": array("kFailurePicture")}
    strip = array("kSpinnerStrip")
    frame = SPINNER_SIZE * SPINNER_SIZE
    pictures.update({f"spinner{i}": strip[i * frame : (i + 1) * frame] for i in range(len(strip) // frame)})
    return {name: [tuple(table[3 * i : 3 * i + 3]) for i in indexes] for name, indexes in pictures.items()}


def check_screen(image, expect, artwork=None):
    """Problems with a screenshot against `expect` (ScreenExpect) in two lists: the background and the picture
    (exactly, centred; without `artwork`, anything there), and anything else on the screen (what isn't
    background larger than the picture or off the centre)."""
    if expect.background is None:  # a screen of no fixed background: only taken
        return [], []
    background = bytes(expect.background)
    if image.pixel(0, 0) != expect.background:
        return [f"screen: background {image.pixel(0, 0)}, wanted {expect.background}"], []
    problems = []
    x0, y0 = (image.width - PICTURE_SIZE) >> 1, (image.height - PICTURE_SIZE) >> 1
    if artwork is not None and expect.picture is not None:
        wanted = artwork[expect.picture]
        wrong = [(x, y) for y in range(PICTURE_SIZE) for x in range(PICTURE_SIZE)
                 if image.pixel(x0 + x, y0 + y) != wanted[y * PICTURE_SIZE + x]]
        if wrong:
            x, y = wrong[0]
            problems.append(f"screen: {len(wrong)} pixels of the {expect.picture} at ({x0}, {y0}) differ; first at "
                            f"({x}, {y}): {image.pixel(x0 + x, y0 + y)}, wanted {wanted[y * PICTURE_SIZE + x]}")
    elif all(image.rows[y0 + y][3 * x0 : 3 * (x0 + PICTURE_SIZE)] == background * PICTURE_SIZE
             for y in range(PICTURE_SIZE)):  # fmt: skip
        problems.append(f"screen: no picture at ({x0}, {y0})")

    blank = background * image.width
    left, top, right, bottom = image.width, image.height, -1, -1
    for y, row in enumerate(image.rows):
        if row == blank:
            continue
        columns = [x for x in range(image.width) if row[3 * x : 3 * x + 3] != background]
        left, right = min(left, columns[0]), max(right, columns[-1])
        top, bottom = min(top, y), max(bottom, y)
    stray = []
    if right >= 0:
        spans = f"screen: all that isn't background spans {right - left + 1} x {bottom - top + 1} at ({left}, {top})"
        if right - left + 1 > PICTURE_SIZE or bottom - top + 1 > PICTURE_SIZE:
            stray.append(f"{spans}, more than {PICTURE_SIZE} x {PICTURE_SIZE}")
        if abs(left + right + 1 - image.width) > 2 or abs(top + bottom + 1 - image.height) > 2:
            stray.append(f"{spans}, not centred on {image.width} x {image.height}")
    return problems, stray


def spinner_frame(image, artwork):
    """The spinner's frame in its square; None when all background, -1 for anything else."""
    x0 = (image.width - SPINNER_SIZE) >> 1
    y0 = ((image.height - SPINNER_SIZE) >> 1) + SPINNER_DROP
    square = [image.pixel(x0 + x, y0 + y) for y in range(SPINNER_SIZE) for x in range(SPINNER_SIZE)]
    if all(pixel == square[0] for pixel in square) and square[0] == image.pixel(0, 0):
        return None
    for name, pixels in artwork.items():
        if name.startswith("spinner") and pixels == square:
            return int(name[len("spinner") :])
    return -1


def check_spinner(paths, expect):
    """Problems with the spinner in the screenshots: "turning" wants two different frames of it in
    two, "gone" its square all background in the first."""
    if expect.spinner is None:
        return []
    try:
        artwork = read_artwork()
        frames = [spinner_frame(read_ppm(Path(p).read_bytes()), artwork) for p in paths if p and Path(p).is_file()]
    except (OSError, ValueError) as error:
        return [f"spinner: {error}"]
    if expect.spinner == "gone":
        return [] if frames and frames[0] is None else [f"spinner: frames {frames}, wanted its square empty"]
    if len(frames) < 2 or None in frames or -1 in frames:
        return [f"spinner: frames {frames} in the screenshots, wanted a frame of the spinner in two"]
    if frames[0] == frames[1]:
        return [f"spinner: frame {frames[0]} in both screenshots {SPINNER_GAP} s apart: it doesn't turn"]
    return []


def check_screenshot(path, expect):
    """check_screen of a screenshot file; a missing or unreadable file is a problem of the first list."""
    if path is None or not Path(path).is_file():
        return [f"screen: no screenshot (nothing matched {expect.when!r} in time)"], []
    try:
        image = read_ppm(Path(path).read_bytes())
        artwork = read_artwork() if expect.picture else None
    except (OSError, ValueError) as error:
        return [f"screen: {error}"], []
    return check_screen(image, expect, artwork)


# The firmware's text console draws each character in a cell of 8 x 19
# pixels, the same character the same way.
CELL_WIDTH, CELL_HEIGHT = 8, 19


def cell(image, x, y):
    """The pixels of the character cell at (x, y) as a tuple of rows; None for a blank."""
    rows = tuple(image.rows[y + dy][3 * x : 3 * (x + CELL_WIDTH)] for dy in range(CELL_HEIGHT))
    return None if all(row == rows[0][:3] * CELL_WIDTH for row in rows) else rows


def find_text(image, text):
    """Where a line of the firmware's text console reads `text` (then a blank cell): (x, y) of its first cell
    (or a few rows above, within the glyphs' blank tops), or None. Its cells are blank exactly where `text`
    has blanks and alike exactly where `text` has the same character: a pattern that no other text of the
    length, and no picture, gives by chance."""
    pattern = list(text) + [" "]
    width = CELL_WIDTH * len(pattern)
    for y in range(image.height - CELL_HEIGHT + 1):
        for x in range(min(CELL_WIDTH, image.width - width + 1)):
            seen = {}  # character -> its cell
            for i, char in enumerate(pattern):
                got = cell(image, x + i * CELL_WIDTH, y)
                if (got is None) != (char == " ") or seen.setdefault(char, got) != got:
                    break
                if char != " " and list(seen.values()).count(got) > 1:
                    break
            else:
                return x, y
    return None


def watch_screen(scenario, workdir):
    """qemuboot's on_tick for a bare machine: screenshots until every line of `screen_text` is on the screen,
    then Enter, then the run stops once the first line is gone and `after_key` is there. Returns it and the
    list of what it saw."""
    steps = [scenario.screen_text, (scenario.after_key,)]
    seen = []

    def on_tick(qmp):
        shot = workdir / "screen.ppm"
        qmp.screendump(shot)
        image = read_ppm(shot.read_bytes())
        wanted = steps[len(seen)]
        if all(find_text(image, line) for line in wanted) and (not seen or not find_text(image, seen[0][0])):
            seen.append(wanted)
            shot.rename(workdir / f"screen-{len(seen)}.ppm")
            if len(seen) == len(steps):
                return True
            qmp.execute("send-key", keys=[{"type": "qcode", "data": "ret"}])
        return False

    return on_tick, seen


# --- the disk -------------------------------------------------------------------------


def config_value(value):
    """A value as platform.cfg writes it: quoted with escapes when it has blanks at its ends, a
    leading quote, a tab or a line break, else as it stands."""
    value = str(value)
    if value == value.strip(" \t") and not value.startswith('"') and not re.search(r"[\r\n\t]", value):
        return value
    escaped = value.replace("\\", "\\\\").replace('"', '\\"')
    escaped = escaped.replace("\n", "\\n").replace("\r", "\\r").replace("\t", "\\t")
    return f'"{escaped}"'


def render_config(keys):
    """platform.cfg text from a mapping."""
    return "".join(f"{key}={config_value(value)}\n" for key, value in keys.items())


def scenario_config(scenario, override=None):
    """The keys of the scenario's platform.cfg: the base configuration unless the scenario opts out,
    then its own, then `override`; a later value of a key replaces an earlier one in its place."""
    return {**(BASE_CONFIG if scenario.base_config else {}), **scenario.config, **(override or {})}


def content_bytes(content, guest_dir=GUEST_DIR):
    """The bytes of a file's content: bytes, text, a host Path or a GuestFile."""
    if isinstance(content, GuestFile):
        path = Path(guest_dir) / content.name
        if not path.is_file():
            raise FileNotFoundError(f"{path} is missing: build the target guest_kernel first")
        data = path.read_bytes()
        return data + bytes(max(0, content.pad_to - len(data)))
    if isinstance(content, Path):
        return content.read_bytes()
    return content.encode() if isinstance(content, str) else bytes(content)


def stage_volume(scenario, volume, config, guest_dir=GUEST_DIR):
    """Writes the scenario's files, directories, platform.cfg (of `config`) and times into `volume`."""
    files = {**(scenario.extensions or {}), **scenario.files}
    if config:
        files[f"{mkdisk.BOOT_DIR}/{mkdisk.CONFIG_NAME}"] = render_config(config)
    for directory in scenario.directories:
        (volume / directory.strip("/")).mkdir(parents=True, exist_ok=True)
    for path, content in files.items():
        target = volume / path.strip("/")
        target.parent.mkdir(parents=True, exist_ok=True)
        target.write_bytes(content_bytes(content, guest_dir))
    # Deepest first: setting a directory's time after its children's.
    for path, when in sorted(scenario.times.items(), key=lambda item: -item[0].count("/")):
        mkdisk.set_time(volume / path.strip("/"), mkdisk.parse_time(when))


def make_cache(cache, volume, disk_bytes=mkdisk.DISK_BYTES):
    """Writes the kernel cache of `cache` (KernelCache) on the staged volume with kcache, then shifts
    its time or breaks its checksum as asked. Returns its name, as kcache printed it."""
    kcache = Path(TOOLS_DIR) / "kcache"
    if not kcache.is_file():
        raise FileNotFoundError(f"{kcache} is missing: build the target kcache first")
    args = [str(kcache), str(volume / cache.kernel), "--model", cache.model,
            "--boot-path-hex", mkdisk.boot_device_path(disk_bytes=disk_bytes).hex(), "--volume", str(volume)]
    args += [str(volume / arg[len("volume:"):]) if arg.startswith("volume:") else arg for arg in cache.args]
    name = subprocess.run(args, check=True, capture_output=True, text=True).stdout.strip().splitlines()[-1]
    path = volume / name.replace("\\", "/")
    when = path.stat().st_mtime_ns
    if cache.break_checksum:
        data = bytearray(path.read_bytes())
        data[8] ^= 0xFF  # the header's Adler-32
        path.write_bytes(data)
    mkdisk.set_time(path, when + int(cache.shift * 1_000_000_000))
    return name


def prepare(scenario, efi_dir, workdir, config_override=None, guest_dir=GUEST_DIR):
    """Builds the scenario's disk (or served directory) in `workdir`; returns its path and the name
    of the kernel cache on it, or None."""
    efi_dir = Path(efi_dir)
    volume = workdir / "volume"
    volume.mkdir()
    disk_bytes = scenario.disk_mib << 20
    raw, resume_keys = None, {}
    if scenario.resume is not None:
        raw, resume_keys = make_resume(scenario.resume, workdir, guest_dir, disk_bytes)
    config = {**resume_keys, **scenario_config(scenario, config_override)}
    stage_volume(scenario, volume, config, guest_dir)
    cache_name = make_cache(scenario.cache, volume, disk_bytes) if scenario.cache is not None else None
    loader = efi_dir / "nimbboot.efi"
    if scenario.network:
        return serve_directory(volume, efi_dir / "BOOTX64.efi", loader), cache_name
    disk = workdir / "disk.img"
    if scenario.usb:
        disk_bytes = mkdisk.stick_bytes(volume)
    try:
        mkdisk.build_disk(disk, volume, efi_dir / "BOOTX64.efi", loader, disk_bytes=disk_bytes,
                          raw=raw, raw_guid=RESUME_PARTITION_GUID,
                          config=mkdisk.STICK_CONFIG if scenario.usb and not config else None)
    except mkdisk.DiskError as error:
        raise OSError(str(error)) from error
    return disk, cache_name


# --- hibernation resume -----------------------------------------------------------------

RESUME_PARTITION = 2  # where make_resume puts the image
READ_LINE = re.compile(rf"platform: read partition={RESUME_PARTITION} offset=0x([0-9a-f]+) size=0x([0-9a-f]+) "
                       r"to=0x([0-9a-f]+)")
KEY_COPY = re.compile(r"platform: key copy at 0x([0-9a-f]+) type (\d+)")
KEY_TRACE = re.compile(r'resume trace kind=key address=0x([0-9a-f]+) where="([^"]*)"')


def make_resume(resume, workdir, guest_dir, disk_bytes):
    """Writes the resume image onto a partition image with mkresume and the restart probe; returns
    its path and the platform.cfg keys that ask for the restart."""
    probe = Path(guest_dir) / RESUME_PROBE
    if not probe.is_file():
        raise FileNotFoundError(f"{probe} is missing: build the target guest_kernel first")
    partition, settings = workdir / "resume.img", workdir / "resume.cfg"
    command = [
        sys.executable, str(RESUME_TOOL), "--restart", str(probe), "--partition", str(partition),
        "--partition-bytes", str(resume.partition_bytes), "--partition-number", str(RESUME_PARTITION),
        "--partition-guid", RESUME_PARTITION_GUID, "--partition-start-lba", str(mkdisk.raw_partition_lba(disk_bytes)),
        "--partition-lbas", str(resume.partition_bytes // 512), "--nvram-out", str(settings),
        *resume.args,
    ]  # fmt: skip
    if resume.preview is not None:
        picture = workdir / "preview.ppm"
        picture.write_bytes(resume.preview())
        command += ["--preview", str(picture)]
    subprocess.run(command, check=True, capture_output=True)
    return partition, dict(line.split("=", 1) for line in settings.read_text().splitlines() if "=" in line)


def check_key_trace(log):
    """Problems with the key's copies that the restart probe found "elsewhere": any that the
    platform did not find before the loader started, the loader left behind."""
    firmware = {int(address, 16) for address, _ in KEY_COPY.findall(log)}
    found = KEY_TRACE.findall(log)
    return [f"key: the key's bytes at {address} are no copy of the firmware's" for address, where in found
            if where == "elsewhere" and int(address, 16) not in firmware]  # fmt: skip


def check_resume_reads(log, expect):
    """Problems with the loader's reads of the image's partition before the reset (ResumeReads): the
    header first, then at most `after_header` reads inside the first stage behind a page-aligned header."""
    if expect is None:
        return []
    reads = [tuple(int(v, 16) for v in m) for m in READ_LINE.findall(log)]
    if not reads or reads[0][1] != 512:
        return [f"reads: the first read is not the 512-byte header: {reads[:1]}"]
    problems, later = [], reads[1:]
    if expect.after_header is not None and len(later) > expect.after_header:
        problems.append(f"reads: {len(later)} reads after the header, wanted at most {expect.after_header}")
    if later:
        header = later[0][2] - 512
        if header % 4096:
            problems.append(f"reads: the first read behind the header lands at {later[0][2]:#x}, no page + 512")
        for offset, size, to in later:
            if not (header + 512 <= to and to + size <= header + expect.first_stage):
                problems.append(f"reads: {size:#x} bytes to {to:#x} leave the first stage at {header:#x}")
    return problems


# --- runs -----------------------------------------------------------------------------


Result = collections.namedtuple("Result", "passed seconds outcome problems log workdir")


def watch(scenario, workdir, served, png=False, keys_on_line=None):
    """qemuboot's on_line for a scenario: its screenshots (with `png`, one as screen.png too), its actions,
    its count of starts and `keys_on_line`. Returns it, the shots taken, a list of troubles, the actions not
    done and the line it stopped at."""
    shots, trouble, pending, starts, stopped = [], [], list(scenario.actions), [0], []

    def on_line(line, qmp):
        if keys_on_line is not None:
            keys_on_line(line)
        if scenario.screen is not None and not shots and scenario.screen.when in line:
            shots.append(workdir / "screen.ppm")
            qmp.screendump(shots[0])
            if png:
                qmp.screendump(workdir / "screen.png")
            if scenario.screen.spinner == "turning":
                time.sleep(SPINNER_GAP)
                shots.append(workdir / "screen-2.ppm")
                qmp.screendump(shots[1])
        for text, action in [item for item in pending if item[0] in line]:
            pending.remove((text, action))
            if action[0] == "link-off":
                qmp.execute("set_link", name=NET_ID, up=False)
            else:  # ("truncate", path, size)
                os.truncate(Path(served) / action[1], action[2])
        if scenario.stop_at and scenario.stop_at in line:
            stopped.append(line)
            return True
        starts[0] += line.startswith("platform: started")
        if starts[0] > scenario.boots:
            trouble.append(f"boots: the machine started more than {scenario.boots} times; stopped")
            return True
        return False

    return on_line, shots, trouble, pending, stopped


def hold_keys(scenario):
    """QEMU's extra arguments, qemuboot's on_tick and an on_line (following the platform's start and
    keyboard reading) for the scenario's held keys; empty or None without them."""
    if not scenario.held:
        return (), None, None
    events = [{"type": "key", "data": {"down": True, "key": {"type": "qcode", "data": key}}}
              for key in scenario.held]  # fmt: skip
    state = {"resumed": False, "started": False, "read": False}

    def on_tick(qmp):
        if not state["resumed"]:
            qmp.execute("cont")  # input events are refused while the machine is paused
            qmp.execute("input-send-event", events=events)
            state["resumed"] = True
        elif state["started"] and not state["read"]:
            qmp.execute("input-send-event", events=events)

    def on_line(line):
        # The firmware's boot manager runs once its keyboard drivers have started.
        state["started"] |= "BdsDxe:" in line or line.startswith("platform: started")
        state["read"] |= line.startswith("platform: keys:")

    usb = ("-device", "qemu-xhci", "-device", "usb-kbd") if scenario.usb_keyboard else ()
    return ("-S", *usb), on_tick, on_line


def run_scenario(scenario, efi_dir, guest_dir=GUEST_DIR, echo=False):
    start = time.monotonic()
    workdir = Path(tempfile.mkdtemp(prefix=f"nimb-qemu-{scenario.name}-"))
    try:
        disk, cache_name = prepare(scenario, efi_dir, workdir, guest_dir=guest_dir)
    except BaseException:
        shutil.rmtree(workdir, ignore_errors=True)
        raise
    limit, screen = scenario.timeout, scenario.screen
    earlier, error = "", None
    if scenario.before_config is not None:
        # The earlier power-on, from the same volume with its own platform.cfg.
        first = dataclasses.replace(scenario, config=scenario.before_config, before_config=None)
        (workdir / "before").mkdir()
        first_disk, _ = prepare(first, efi_dir, workdir / "before", guest_dir=guest_dir)
        _, earlier, error = boot(first_disk, workdir, limit, echo=echo, extra=scenario.qemu_args, usb=scenario.usb)
    held_args, keys_tick, keys_on_line = hold_keys(scenario)
    on_line, shots, trouble, pending, stopped = watch(scenario, workdir, disk, echo, keys_on_line)
    on_tick, seen = watch_screen(scenario, workdir) if scenario.screen_text else (None, [])
    returncode, log, later_error = boot(disk, workdir, limit, on_line, network=scenario.network,
                                        reboot=scenario.boots > 1,
                                        qmp=bool(screen or scenario.actions or on_tick or keys_tick), echo=echo,
                                        extra=(*scenario.qemu_args, *held_args), bare=scenario.bare,
                                        on_tick=keys_tick or on_tick, tick=0.05 if keys_tick else 0.5,  # never both
                                        usb=scenario.usb, same_store=True)
    error = error or later_error
    (workdir / "serial.txt").write_text(earlier + log)
    done = stopped or (on_tick and len(seen) == 2)
    outcome = Outcome("Stopped") if done else decode_exit(returncode, read_exit_codes())
    problems = ([f"timed out after {limit} s"] if returncode is None else []) + ([f"qemu: {error}"] if error else [])
    problems += check_report(log, outcome, scenario.status, scenario.memory, scenario.exit) + trouble
    problems += check_log(earlier + log, scenario.expect, scenario.forbid)
    problems += check_console_modes(log, scenario.console_modes)
    problems += [f"action {action!r} not done: {text!r} never came" for text, action in pending]
    if on_tick and len(seen) < 2:
        wanted = scenario.screen_text if not seen else (f"{scenario.after_key!r} after Enter",)
        problems.append(f"screen: never showed {wanted} (last shot: {workdir / 'screen.ppm'})")
    if cache_name is not None and scenario.cache.looked_for:
        # The name that kcache gave the cache, from the boot device path the
        # disk tool computes, is the one the loader looks for.
        problems += check_log(log, [f"Looking for kernel cache file '{cache_name}'"])
    if scenario.kernel is not None:
        problems += check_kernel(log, scenario.kernel, guest_dir)
    if scenario.capture:
        problems += check_capture(log, workdir / "net.pcap")
    if scenario.boots > 1 and log.count("platform: started") != scenario.boots:
        problems.append(f"the machine started {log.count('platform: started')} times, wanted {scenario.boots}")
    problems += check_resume_reads(log, scenario.reads)
    if scenario.resume is not None:
        problems += check_key_trace(log)
    if screen is not None:
        picture, stray = check_screenshot(shots[0] if shots else None, screen)
        problems += picture + check_spinner(shots, screen) + (stray if screen.alone else [])
        for problem in [] if screen.alone else stray:
            print(f"  {scenario.name}, not enforced: {problem}")
    return Result(not problems, time.monotonic() - start, outcome, problems, log, workdir)


def report(scenario, result):
    print(f"{'PASS' if result.passed else 'FAIL'} {scenario.name} ({result.outcome.name}, {result.seconds:.1f} s)")
    if result.passed:
        shutil.rmtree(result.workdir, ignore_errors=True)
        return
    problems = "".join(f"  {problem}\n" for problem in result.problems)
    print(problems, end="")
    print(f"--- serial log ({result.workdir / 'serial.log'}, cleaned) ---")
    print(result.log.rstrip())
    qemu_log = (result.workdir / "qemu.log").read_text(errors="replace").strip()
    if qemu_log:
        print(f"--- qemu ---\n{qemu_log}")
    # Once more behind the long log, where a reader of the output looks first.
    print(f"--- {scenario.name}: {len(result.problems)} expectation(s) failed ---\n{problems}", end="")
    print(f"--- files kept in {result.workdir} ---")


# --- the demo -------------------------------------------------------------------------

# The demo: the reference kernel with the test driver bundles, from a kernel
# cache that kcache made of both, in graphics mode; or the same kernel with
# its driver package, served over TFTP to a machine without a disk. The
# kernel holds the machine a while after its report, for the screenshot.
DEMO_SCREEN_EXPECT = ScreenExpect(when="kernel: result", picture="logo", alone=False)
DEMO = Scenario("demo", config={"console": "graphics", "options": "guest.hold=4"}, files=kernel_file(),
                cache=KernelCache(args=("--drivers", f"volume:{EXTENSIONS_DIR}")), exit="KernelPass",
                kernel=KernelExpect(drivers_from="cache"), screen=DEMO_SCREEN_EXPECT, timeout=120.0)
NET_DEMO = NetScenario("demo-net", config={"options": "guest.hold=4"}, files=net_kernel_files(), exit="KernelPass",
                       kernel=KernelExpect(), screen=DEMO_SCREEN_EXPECT)


def demo(efi_dir, guest_dir=GUEST_DIR, network=False):
    """Runs the demo, its serial log printed as it comes; its screenshot to out/ (and docs/)."""
    scenario = NET_DEMO if network else DEMO
    result = run_scenario(scenario, efi_dir, guest_dir, echo=True)
    drivers = parse_kernel_report(result.log).drivers
    print(f"\ndemo: drivers from {scenario.kernel.drivers_from or 'the package'}: {[d[0] for d in drivers]}")
    for target in [NET_DEMO_SCREEN] if network else [DEMO_SCREEN, DOCS_SCREEN]:
        if (result.workdir / "screen.png").is_file():
            target.parent.mkdir(parents=True, exist_ok=True)
            shutil.copyfile(result.workdir / "screen.png", target)
            print(f"demo: screenshot in {target}")
    report(scenario, result)
    return result.passed


# --- command line ---------------------------------------------------------------------


def main(argv=None):
    global TOOLS_DIR
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--efi-dir", default=str(REPO / "build" / "efi"), help="where BOOTX64.efi and nimbboot.efi are")
    parser.add_argument("--guest-dir", default=str(GUEST_DIR), help="where the reference kernel's files are")
    parser.add_argument("--tools-dir", default=str(TOOLS_DIR), help="where the host tools (kcache) are")
    parser.add_argument("--scenario", action="append", help="run this scenario (repeatable; default all)")
    parser.add_argument("--list", action="store_true", help="print the scenarios' names")
    parser.add_argument("--demo", action="store_true", help="boot the reference kernel and take a screenshot")
    parser.add_argument("--net", action="store_true", help="with --demo: boot it over the network")
    args = parser.parse_args(argv)
    for number in (signal.SIGTERM, signal.SIGINT, signal.SIGHUP):
        signal.signal(number, Machine.kill_all)
    TOOLS_DIR = Path(args.tools_dir)
    if args.list:
        print("\n".join(SCENARIOS))
        return 0
    if args.demo:
        return 0 if demo(args.efi_dir, args.guest_dir, args.net) else 1
    names = args.scenario or list(SCENARIOS)
    unknown = [name for name in names if name not in SCENARIOS]
    if unknown:
        parser.error(f"unknown scenario(s): {', '.join(unknown)}")
    failed = 0
    for name in names:
        try:
            result = run_scenario(SCENARIOS[name], args.efi_dir, args.guest_dir)
        except (OSError, subprocess.CalledProcessError) as error:
            detail = getattr(error, "stderr", None) or b""
            print(f"FAIL {name}: {error} {detail.decode(errors='replace').strip()}")
            failed += 1
            continue
        report(SCENARIOS[name], result)
        failed += not result.passed
    return 1 if failed else 0


if __name__ == "__main__":
    sys.exit(main())
