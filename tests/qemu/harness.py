#!/usr/bin/env python3
"""Boots the EFI programs under QEMU and OVMF and checks what they print.

Each scenario (scenarios.py) describes an EFI system partition: the platform
layer at \\EFI\\BOOT\\BOOTX64.EFI, the loader at \\EFI\\BOOT\\nimbboot.efi, the
platform's configuration file and any other files and directories, such as
the reference kernel of tests/guest/, an extensions directory of test driver
bundles, exact times for some of them and a kernel cache that kcache writes.
The harness stages them in a directory and has the disk tool
(tools/mkdisk/mkdisk.py) make a GPT disk image of it, boots it headless under
TCG, and reads the serial log, the exit code that the platform layer or the
kernel leaves through the debug-exit device, the kernel's report and, when
the scenario asks, a screenshot taken over QMP.

    harness.py --efi-dir build/efi --scenario no_kernel    one scenario
    harness.py --efi-dir build/efi                          all scenarios
    harness.py --list                                        names only
    harness.py --demo                                        boot the kernel, screenshot into out/
"""

import argparse
import dataclasses
import json
import os
import re
import shutil
import signal
import socket
import struct
import subprocess
import sys
import tempfile
import time
import zlib
from pathlib import Path

sys.path.insert(0, str(Path(__file__).resolve().parent))
from scenarios import (  # noqa: E402
    BASE_CONFIG,
    RESUME_PARTITION_GUID,
    EXTENSIONS_DIR,
    KernelCache,
    mkdisk,
    SCENARIOS,
    NET_MAC,
    GuestFile,
    NetScenario,
    Scenario,
    ScreenExpect,
    kernel_file,
    net_kernel_files,
    quoted,
)

REPO = Path(__file__).resolve().parents[2]
# The exit codes of the platform layer and of the reference kernel: one
# table, no code in both.
EXIT_CODE_HEADERS = (REPO / "platform" / "exitcodes.h", REPO / "tests" / "guest" / "exitcodes.h")
GUEST_DIR = REPO / "build" / "tests" / "guest"
# The host tools (kcache); --tools-dir changes it.
TOOLS_DIR = REPO / "build" / "tools"
ARTWORK = REPO / "src" / "screen" / "artwork.cpp"
DEMO_SCREEN = REPO / "out" / "demo-screen.png"
DOCS_SCREEN = REPO / "docs" / "demo-screen.png"

OVMF_DIRS = ("/usr/share/OVMF", "/usr/share/ovmf", "/usr/share/qemu")
RESUME_TOOL = REPO / "tools" / "mkresume" / "mkresume.py"
RESUME_PROBE = "resume_probe.elf"

# The platform's report, on the serial port.
REPORT_STATUS = re.compile(r"platform: loader returned 0x([0-9a-f]+) \((\w+)\)")
REPORT_MEMORY = re.compile(r"platform: memory (same|changed)")
REPORT_CONSOLE_MODE = re.compile(r"platform: console mode (\S+)")


# --- exit codes -----------------------------------------------------------------------


@dataclasses.dataclass(frozen=True)
class Outcome:
    """What a run's exit status says."""

    name: str  # the name of the code in its header, or a word of the harness's own
    status: str | None = None  # the loader's status, when the loader came back
    memory: str | None = None  # "same" or "changed", when the loader came back


STATUS_OF_PREFIX = {"Aborted": "EFI_ABORTED", "Success": "EFI_SUCCESS", "Other": "other"}


def read_exit_codes(headers=EXIT_CODE_HEADERS):
    """The kExit... constants of the headers (one path or several) as one
    table: code -> Outcome. A code or a name given twice, in one header or
    across them, is refused."""
    if isinstance(headers, (str, Path)):
        headers = (headers,)
    codes, origin = {}, {}
    pattern = re.compile(r"constexpr\s+UINT8\s+kExit(\w+)\s*=\s*(0x[0-9A-Fa-f]+|\d+)\s*;")
    for header in headers:
        found = 0
        for match in pattern.finditer(Path(header).read_text()):
            name, code = match.group(1), int(match.group(2), 0)
            outcome = Outcome(name)
            loader = re.fullmatch(r"(Aborted|Success|Other)(Same|Changed)", name)
            if loader:
                outcome = Outcome(name, STATUS_OF_PREFIX[loader.group(1)], loader.group(2).lower())
            if code in codes:
                raise ValueError(f"{header}: code {code:#x} given twice (also in {origin[code]})")
            if any(known.name == name for known in codes.values()):
                raise ValueError(f"{header}: name {name} given twice")
            codes[code], origin[code] = outcome, header
            found += 1
        if not found:
            raise ValueError(f"{header}: no exit codes found")
    return codes


def decode_exit(returncode, codes):
    """QEMU's exit status as an Outcome. The debug-exit device makes QEMU exit
    with (code << 1) | 1; a plain power-off is 0."""
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

# Escape sequences of the firmware's terminal emulation: CSI sequences,
# character set selections and two-character escapes.
ANSI_ESCAPE = re.compile(r"\x1b(?:\[[0-?]*[ -/]*[@-~]|[()][0-9A-Za-z]|[@-Z\\-_78=>c])")
CONTROL = re.compile(r"[\x00-\x08\x0b-\x1f\x7f]")


def clean_log(raw):
    """Serial output as plain text: escapes, carriage returns and other
    control characters removed."""
    text = raw.decode("utf-8", errors="replace") if isinstance(raw, bytes) else raw
    return CONTROL.sub("", ANSI_ESCAPE.sub("", text.replace("\r", "")))


def check_log(log, expect=(), forbid=()):
    """Problems with `log`: strings of `expect` missing or out of order, any of
    `forbid` present. An empty list means the log is as wanted."""
    problems = []
    position = 0
    for text in expect:
        found = log.find(text, position)
        if found < 0:
            where = "at all" if log.find(text) < 0 else "after the text before it"
            problems.append(f"missing {where}: {text!r}")
        else:
            position = found + len(text)
    for text in forbid:
        if text in log:
            problems.append(f"present but forbidden: {text!r}")
    return problems


def check_console_modes(log, wanted):
    """Problems with the console mode changes that the loader asked for
    against all those `wanted`, in order; None checks nothing."""
    if wanted is None:
        return []
    asked = REPORT_CONSOLE_MODE.findall(log)
    return [] if asked == list(wanted) else [f"console modes asked for: {asked}, wanted {list(wanted)}"]


def check_report(log, outcome, status, memory, exit_name):
    """Problems with the platform's report and exit code against what the
    scenario expects. `exit_name` overrides the outcome expected from status
    and memory (for runs where the platform itself fails)."""
    problems = []
    if exit_name is not None:
        if outcome.name != exit_name:
            problems.append(f"exit: wanted {exit_name}, got {outcome.name}")
        return problems
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
KERNEL_MEMMAP_TYPE = re.compile(r"type (\S+) count=(\d+) pages=(0x[0-9a-f]+)")
KERNEL_HOLD = re.compile(r"(\d+) s")
KERNEL_VALUE = re.compile(r"(\S+) (.+) ([0-9a-f]*)")
KERNEL_DRIVER = re.compile(r'(".*") from=(\w+) address=(0x[0-9a-f]+) plist=(0x[0-9a-f]+) code=(0x[0-9a-f]+) sum=(0x[0-9a-f]+)')
TREE_NODE = re.compile(r"( *)([^=]*)/ \((\d+) propert(?:y|ies), (\d+) child(?:ren)?\)")
TREE_PROPERTY = re.compile(r"( *)(\S.*?) = (.*)")
ROOT_UUID_MESSAGE = re.compile(r"root device uuid is '(.*)'")


@dataclasses.dataclass(frozen=True)
class KernelCheck:
    name: str
    ok: bool
    detail: str


@dataclasses.dataclass
class KernelReport:
    """The kernel's `kernel: ...` lines of a serial log (tests/guest/report.h)."""

    starts: int = 0
    entry: dict = dataclasses.field(default_factory=dict)  # register -> number
    checks: list = dataclasses.field(default_factory=list)  # KernelCheck, in order
    bootargs: dict = dataclasses.field(default_factory=dict)  # field -> number or text
    tree_lines: list = dataclasses.field(default_factory=list)  # as printed, indent kept
    tree: dict = dataclasses.field(default_factory=dict)  # node path -> {property: value as printed}
    tree_errors: list = dataclasses.field(default_factory=list)
    values: dict = dataclasses.field(default_factory=dict)  # (node path, property) -> whole value, bytes
    ranges: dict = dataclasses.field(default_factory=dict)  # name -> (address, length)
    memmap: list = dataclasses.field(default_factory=list)  # the memmap lines
    memmap_types: dict = dataclasses.field(default_factory=dict)  # type -> (count, pages)
    efi: dict = dataclasses.field(default_factory=dict)  # field -> number
    result: tuple | None = None  # (passed, checks, failed) of the result line
    hold: int | None = None  # seconds of a hold line
    drivers: list = dataclasses.field(default_factory=list)  # (identifier, from, plist, code, sum), in order
    package: tuple | None = None  # (length, sum) of the driver package
    drivers_from: str | None = None  # "loader", "cache" or "none"
    tsc: dict = dataclasses.field(default_factory=dict)  # moment -> time stamp counter
    unknown: list = dataclasses.field(default_factory=list)  # lines of no known kind
    resume: list = dataclasses.field(default_factory=list)  # the restart probe's own lines

    def failed_checks(self):
        return [check for check in self.checks if not check.ok]


def unquote(value):
    """A quoted text of the report as (text, rest of the line): escapes
    undone, each byte one character (\\xNN stays the byte NN)."""
    if not value.startswith('"'):
        raise ValueError(f"not a quoted text: {value!r}")
    out, i = [], 1
    while i < len(value):
        char = value[i]
        if char == '"':
            return "".join(out), value[i + 1 :]
        if char == "\\" and value[i + 1 : i + 2] in ('"', "\\"):
            out.append(value[i + 1])
            i += 2
        elif char == "\\" and re.fullmatch(r"x[0-9a-f]{2}", value[i + 1 : i + 4]):
            out.append(chr(int(value[i + 2 : i + 4], 16)))
            i += 4
        else:
            out.append(char)
            i += 1
    raise ValueError(f"unterminated text: {value!r}")


def report_value(value):
    """A value of the report: a quoted text, else a C number, else as it stands."""
    if value.startswith('"'):
        return unquote(value)[0]
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
        elif kind == "entry":
            report.entry.update(fields(rest))
        elif kind == "check" and KERNEL_CHECK.fullmatch(rest):
            name, ok, detail = KERNEL_CHECK.fullmatch(rest).groups()
            report.checks.append(KernelCheck(name, ok == "ok", detail or ""))
        elif kind == "bootargs" and "=" in rest:
            name, value = rest.split("=", 1)
            report.bootargs[name] = report_value(value)
        elif kind == "tree" and rest.startswith("error "):
            report.tree_errors.append(rest[len("error ") :])
        elif kind == "tree":
            report.tree_lines.append(rest)
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
        elif kind == "memmap":
            report.memmap.append(rest)
            typed = KERNEL_MEMMAP_TYPE.fullmatch(rest)
            if typed:
                report.memmap_types[typed.group(1)] = (int(typed.group(2)), int(typed.group(3), 16))
        elif kind == "efi":
            report.efi.update(fields(rest))
        elif kind == "result" and KERNEL_RESULT.fullmatch(rest):
            verdict, checks, failed = KERNEL_RESULT.fullmatch(rest).groups()
            report.result = (verdict == "pass", int(checks), int(failed))
        elif kind == "resume":
            report.resume.append(rest)
        elif kind == "driver" and KERNEL_DRIVER.fullmatch(rest):
            identifier, source, _, plist, code, checksum = KERNEL_DRIVER.fullmatch(rest).groups()
            report.drivers.append((unquote(identifier)[0], source, int(plist, 16), int(code, 16), int(checksum, 16)))
        elif kind == "package":
            numbers = fields(rest)
            report.package = (numbers.get("length"), numbers.get("sum"))
        elif kind == "tsc":
            report.tsc.update(fields(rest))
        elif kind == "drivers":
            report.drivers_from = fields(rest).get("from")
        elif kind == "hold" and KERNEL_HOLD.fullmatch(rest):
            report.hold = int(KERNEL_HOLD.fullmatch(rest).group(1))
        else:
            report.unknown.append(match.group(0))
    return report


def matches(wanted, value):
    """Whether `value` is as `wanted`: a compiled pattern matches the whole
    text, a callable says so, anything else is equal."""
    if isinstance(wanted, re.Pattern):
        return isinstance(value, str) and wanted.fullmatch(value) is not None
    if callable(wanted):
        return wanted(value)
    return value == wanted


def describe(wanted):
    if isinstance(wanted, re.Pattern):
        return f"/{wanted.pattern}/"
    if callable(wanted):
        return str(wanted)
    return repr(wanted)


def content_bytes(content, guest_dir=GUEST_DIR):
    """The bytes of a file's content as scenarios give it: bytes, text, a
    host Path or a GuestFile."""
    if isinstance(content, GuestFile):
        data = (Path(guest_dir) / content.name).read_bytes()
        return data + bytes(max(0, content.pad_to - len(data)))
    if isinstance(content, Path):
        return content.read_bytes()
    return content.encode() if isinstance(content, str) else bytes(content)


def check_drivers(report, expect, guest_dir=GUEST_DIR):
    """Problems with the drivers that the kernel reported against `expect`:
    where they came from, the driver blocks in order (identifier, length of
    the text with its zero, length and Adler-32 of the code) and the
    package (length and Adler-32)."""
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
    """Problems with the kernel's report against `expect` (KernelExpect), and
    with what holds in any report: one start, a result line that agrees
    with the checks, no broken tree, a "boot-uuid" that is the text the
    loader printed."""
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
        problems.append(
            f"kernel: result line says {report.result}, the checks {len(report.checks)} of which "
            f"{len(failed)} failed"
        )
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
    """(client MAC, server's DHCP messages) of the captured frames: the
    Ethernet source of the client's first message and the UDP payloads
    that left port 67, in order."""
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
    """Problems with the kernel's network identity and answers against the
    packets on the wire: "dhcp-response" must be the server's DHCP ACK byte
    for byte (the firmware keeps no length, so what follows the end option
    may be left off, and must then be padding of zeros), "root-matching"
    the client's MAC."""
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
        problems.append(
            f"capture: dhcp-response of {len(dhcp)} bytes differs from the ACK of {len(ack)} on the wire "
            f"at byte {first}"
        )
    return problems


# --- the screen -----------------------------------------------------------------------

PNG_SIGNATURE = b"\x89PNG\r\n\x1a\n"
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


def read_png(data):
    """An 8-bit RGB or RGBA PNG file, not interlaced (what QEMU's screendump
    writes), as an Image; alpha is dropped."""
    if data[:8] != PNG_SIGNATURE:
        raise ValueError("not a PNG file")
    position, header, compressed = 8, None, bytearray()
    while position < len(data):
        length, kind = struct.unpack(">I4s", data[position : position + 8])
        body = data[position + 8 : position + 8 + length]
        position += 12 + length
        if kind == b"IHDR":
            header = struct.unpack(">IIBBBBB", body)
        elif kind == b"IDAT":
            compressed += body
        elif kind == b"IEND":
            break
    if header is None:
        raise ValueError("PNG file without a header")
    width, height, depth, colour, _, _, interlace = header
    if depth != 8 or colour not in (2, 6) or interlace != 0:
        raise ValueError(f"PNG of depth {depth}, colour type {colour}, interlace {interlace}: not read here")
    step = 3 if colour == 2 else 4
    stride = width * step
    raw = zlib.decompress(bytes(compressed))
    if len(raw) != height * (stride + 1):
        raise ValueError(f"PNG data of {len(raw)} bytes for {width} x {height}")
    rows, previous = [], bytearray(stride)
    for y in range(height):
        kind = raw[y * (stride + 1)]
        row = bytearray(raw[y * (stride + 1) + 1 : (y + 1) * (stride + 1)])
        unfilter(kind, row, previous, step)
        rows.append(bytes(row if step == 3 else b"".join(row[i : i + 3] for i in range(0, stride, 4))))
        previous = row
    return Image(width, height, rows)


def unfilter(kind, row, previous, step):
    """Undoes a PNG row filter in place."""
    if kind == 0:
        return
    if kind == 1:
        for i in range(step, len(row)):
            row[i] = (row[i] + row[i - step]) & 0xFF
    elif kind == 2:
        row[:] = bytes((a + b) & 0xFF for a, b in zip(row, previous))
    elif kind == 3:
        for i in range(len(row)):
            left = row[i - step] if i >= step else 0
            row[i] = (row[i] + ((left + previous[i]) >> 1)) & 0xFF
    elif kind == 4:
        for i in range(len(row)):
            a = row[i - step] if i >= step else 0
            b = previous[i]
            c = previous[i - step] if i >= step else 0
            p = a + b - c
            pa, pb, pc = abs(p - a), abs(p - b), abs(p - c)
            row[i] = (row[i] + (a if pa <= pb and pa <= pc else b if pb <= pc else c)) & 0xFF
    else:
        raise ValueError(f"PNG filter {kind} unknown")


def read_artwork(source=ARTWORK):
    """The loader's pictures, as they should appear on the screen: name ->
    (red, green, blue) tuples, row by row: "logo" and "failure" of 128 x 128,
    "spinner0" to "spinner17" of 32 x 32."""
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
    """Problems with a screenshot against `expect` (ScreenExpect), in two
    lists. The first: the background colour in the corner, and, with
    `artwork` and a picture named, the picture's pixels exactly at the place
    of a centred 128 x 128 picture (without artwork: anything there). The
    second: anything else on the screen, that is a box of all that isn't
    background larger than 128 x 128 or off the centre by more than a pixel."""
    if expect.background is None:  # a screen of no fixed background: only taken
        return [], []
    background = bytes(expect.background)
    if image.pixel(0, 0) != expect.background:
        return [f"screen: background {image.pixel(0, 0)}, wanted {expect.background}"], []
    problems = []
    x0, y0 = (image.width - PICTURE_SIZE) >> 1, (image.height - PICTURE_SIZE) >> 1
    if artwork is not None and expect.picture is not None:
        wanted = artwork[expect.picture]
        wrong = [
            (x, y)
            for y in range(PICTURE_SIZE)
            for x in range(PICTURE_SIZE)
            if image.pixel(x0 + x, y0 + y) != wanted[y * PICTURE_SIZE + x]
        ]
        if wrong:
            x, y = wrong[0]
            problems.append(
                f"screen: {len(wrong)} pixels of the {expect.picture} at ({x0}, {y0}) differ; first at "
                f"({x}, {y}): {image.pixel(x0 + x, y0 + y)}, wanted {wanted[y * PICTURE_SIZE + x]}"
            )
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
    """The number of the spinner's frame in its square of the screen; None
    when the square is all background, -1 when it holds anything else."""
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
    """Problems with the spinner in the screenshots of a scenario: "turning"
    wants a frame of the spinner in each of two, and two different frames;
    "gone" wants its square all background in the first."""
    if expect.spinner is None:
        return []
    try:
        artwork = read_artwork()
        frames = [spinner_frame(read_png(Path(p).read_bytes()), artwork) for p in paths if p and Path(p).is_file()]
    except (OSError, ValueError, zlib.error) as error:
        return [f"spinner: {error}"]
    if expect.spinner == "gone":
        return [] if frames and frames[0] is None else [f"spinner: frames {frames}, wanted its square empty"]
    if len(frames) < 2 or None in frames or -1 in frames:
        return [f"spinner: frames {frames} in the screenshots, wanted a frame of the spinner in two"]
    if frames[0] == frames[1]:
        return [f"spinner: frame {frames[0]} in both screenshots {SPINNER_GAP} s apart: it doesn't turn"]
    return []


def check_screenshot(path, expect):
    """check_screen of a PNG file; a missing or unreadable file is a problem
    of the first list."""
    if path is None or not Path(path).is_file():
        return [f"screen: no screenshot (nothing matched {expect.when!r} in time)"], []
    try:
        image = read_png(Path(path).read_bytes())
        artwork = read_artwork() if expect.picture else None
    except (OSError, ValueError, zlib.error) as error:
        return [f"screen: {error}"], []
    return check_screen(image, expect, artwork)


# --- the disk -------------------------------------------------------------------------


def config_value(value):
    """A value as platform.cfg writes it: quoted with escapes when it has
    blanks at its ends, quotes, backslash escapes' letters or control
    characters, else as it stands."""
    value = str(value)
    plain = value == value.strip(" \t") and not value.startswith('"') and not re.search(r"[\r\n\t]", value)
    if plain:
        return value
    escaped = value.replace("\\", "\\\\").replace('"', '\\"')
    escaped = escaped.replace("\n", "\\n").replace("\r", "\\r").replace("\t", "\\t")
    return f'"{escaped}"'


def render_config(keys):
    """platform.cfg text from a mapping or from (key, value) pairs."""
    items = keys.items() if isinstance(keys, dict) else keys
    return "".join(f"{key}={config_value(value)}\n" for key, value in items)


# --- QEMU -----------------------------------------------------------------------------


def find_ovmf():
    """OVMF_CODE_4M.fd and OVMF_VARS_4M.fd, from the package's file list or the
    usual places."""
    candidates = []
    try:
        listing = subprocess.run(["dpkg", "-L", "ovmf"], capture_output=True, text=True, check=False).stdout
        candidates += [Path(line).parent for line in listing.splitlines() if line.endswith("OVMF_CODE_4M.fd")]
    except OSError:
        pass
    candidates += [Path(d) for d in OVMF_DIRS]
    for directory in candidates:
        code, variables = directory / "OVMF_CODE_4M.fd", directory / "OVMF_VARS_4M.fd"
        if code.is_file() and variables.is_file():
            return code, variables
    raise FileNotFoundError("OVMF_CODE_4M.fd and OVMF_VARS_4M.fd not found (package ovmf)")


# The boot file that QEMU's DHCP server names on a network boot: the
# platform layer, at the root of the served directory.
NET_BOOT_FILE = "BOOTX64.efi"
NET_ID = "n0"


def network_arguments(tftp_dir, pcap=None):
    """QEMU's user network with its TFTP server on `tftp_dir` and a virtio NIC
    without option ROM, so that the firmware's own PXE boots from it; with
    `pcap`, every packet of the NIC is written there."""
    arguments = [
        "-netdev", f"user,id={NET_ID},tftp={tftp_dir},bootfile={NET_BOOT_FILE}",
        "-device", f"virtio-net-pci,netdev={NET_ID},mac={NET_MAC},romfile=",
    ]
    if pcap is not None:
        arguments += ["-object", f"filter-dump,id=dump0,netdev={NET_ID},file={pcap}"]
    return arguments


def qemu_command(workdir, disk, serial_log, qmp_socket=None, network=None, reboot=False, extra=()):
    """QEMU's command line. With `network` (the extra arguments of
    network_arguments) and no `disk`, the machine boots over the network;
    with `reboot`, a reset starts the machine again (on the same variable
    store) instead of ending QEMU; `extra` goes behind the accelerator."""
    code, variables = find_ovmf()
    private_vars = workdir / "OVMF_VARS.fd"
    shutil.copyfile(variables, private_vars)
    command = [
        "qemu-system-x86_64", "-machine", "q35", "-m", "512M", "-accel", "tcg", *extra,
        "-display", "none", *([] if reboot else ["-no-reboot"]),
        "-drive", f"if=pflash,format=raw,unit=0,readonly=on,file={code}",
        "-drive", f"if=pflash,format=raw,unit=1,file={private_vars}",
        *(["-drive", f"format=raw,file={disk}"] if disk is not None else []),
        "-device", "isa-debug-exit,iobase=0xf4,iosize=0x04",
        *(network if network is not None else ["-nic", "none"]),
        "-serial", f"file:{serial_log}", "-monitor", "none",
    ]
    if qmp_socket is not None:
        command += ["-qmp", f"unix:{qmp_socket},server=on,wait=off"]
    return command


def _die_with_parent():
    """In the child before exec: QEMU gets SIGKILL when the harness dies."""
    try:
        import ctypes

        ctypes.CDLL(None, use_errno=True).prctl(1, signal.SIGKILL)  # PR_SET_PDEATHSIG
    except (OSError, AttributeError):
        pass


class Machine:
    """One QEMU process in a process group of its own, killed with its group
    when the time is up, on a signal to the harness, or when the harness ends."""

    running = []

    def __init__(self, command, stderr_path):
        self._stderr = open(stderr_path, "wb")
        self.process = subprocess.Popen(
            command, stdin=subprocess.DEVNULL, stdout=self._stderr, stderr=subprocess.STDOUT,
            start_new_session=True, preexec_fn=_die_with_parent,
        )
        Machine.running.append(self)

    def wait(self, timeout):
        """The exit status, or None when the time ran out (QEMU is then gone)."""
        try:
            return self.process.wait(timeout=timeout)
        except subprocess.TimeoutExpired:
            self.kill()
            return None
        finally:
            self.close()

    def poll(self):
        return self.process.poll()

    def kill(self):
        try:
            os.killpg(self.process.pid, signal.SIGKILL)
        except ProcessLookupError:
            pass
        self.process.wait()

    def close(self):
        if self in Machine.running:
            Machine.running.remove(self)
        self._stderr.close()

    @classmethod
    def kill_all(cls, *_):
        for machine in list(cls.running):
            machine.kill()
            machine.close()
        sys.exit(130)


# --- runs -----------------------------------------------------------------------------


@dataclasses.dataclass
class Result:
    passed: bool
    seconds: float
    outcome: Outcome
    problems: list
    log: str
    workdir: Path


def scenario_config(scenario, override=None):
    """The keys of the scenario's platform.cfg: the base configuration unless
    the scenario opts out, then the scenario's own, then `override`; a later
    value of a key replaces an earlier one in its place."""
    config = dict(BASE_CONFIG) if scenario.base_config else {}
    config.update(scenario.config)
    config.update(override or {})
    return config


def stage_volume(scenario, volume, config, guest_dir=GUEST_DIR):
    """Writes the scenario's files and directories (the extensions
    directory's too) into the host directory `volume`, with platform.cfg
    when `config` has keys or the scenario asks for the file, then gives
    the paths of `scenario.times` their exact times."""
    files = {**(scenario.extensions or {}), **scenario.files}
    if config or scenario.config_file:
        files[f"{mkdisk.BOOT_DIR}/{mkdisk.CONFIG_NAME}"] = render_config(config)
    for path in scenario.remove:
        files.pop(path, None)
    for directory in scenario.directories:
        (volume / directory.strip("/")).mkdir(parents=True, exist_ok=True)
    for path, content in files.items():
        target = volume / path.strip("/")
        target.parent.mkdir(parents=True, exist_ok=True)
        if isinstance(content, GuestFile) and not (Path(guest_dir) / content.name).is_file():
            raise FileNotFoundError(f"{Path(guest_dir) / content.name} is missing: build the target guest_kernel first")
        target.write_bytes(content_bytes(content, guest_dir))
    # Deepest first: setting a directory's time after its children's.
    for path, when in sorted(scenario.times.items(), key=lambda item: -item[0].count("/")):
        mkdisk.set_time(volume / path.strip("/"), mkdisk.parse_time(when))


def make_cache(cache, volume, disk_bytes=mkdisk.DISK_BYTES):
    """Writes the kernel cache of `cache` (KernelCache) on the staged
    volume with kcache, for the machine the harness boots (model and boot
    device path of a disk of `disk_bytes`), then shifts its time or breaks
    its checksum as asked. Returns the name the loader will look for, as
    kcache printed it."""
    kcache = Path(TOOLS_DIR) / "kcache"
    if not kcache.is_file():
        raise FileNotFoundError(f"{kcache} is missing: build the target kcache first")
    args = [str(kcache), str(volume / cache.kernel), "--model", cache.model,
            "--boot-path-hex", mkdisk.boot_device_path(disk_bytes=disk_bytes).hex(), "--volume", str(volume)]
    for arg in cache.args:
        args.append(str(volume / arg[len("volume:"):]) if arg.startswith("volume:") else arg)
    done = subprocess.run(args, check=True, capture_output=True, text=True)
    name = done.stdout.strip().splitlines()[-1]
    path = volume / name.replace("\\", "/")
    when = path.stat().st_mtime_ns
    if cache.break_checksum:
        data = bytearray(path.read_bytes())
        data[8] ^= 0xFF  # the header's Adler-32
        path.write_bytes(data)
    mkdisk.set_time(path, when + int(cache.shift * 1_000_000_000))
    return name


def prepare(scenario, efi_dir, workdir, loader=None, config_override=None, guest_dir=GUEST_DIR):
    """Builds the scenario's disk in `workdir` with the disk tool. Returns
    its path and the name of the kernel cache on it, or None."""
    efi_dir = Path(efi_dir)
    volume = workdir / "volume"
    volume.mkdir()
    disk_bytes = scenario.disk_mib << 20
    raw, resume_keys = None, {}
    if scenario.resume is not None:
        raw, resume_keys = make_resume(scenario.resume, workdir, guest_dir, disk_bytes)
    config = scenario_config(scenario, config_override)
    for key, value in resume_keys.items():
        config.setdefault(key, value)
    stage_volume(scenario, volume, config, guest_dir)
    cache_name = make_cache(scenario.cache, volume, disk_bytes) if scenario.cache is not None else None
    loader = None if f"{mkdisk.BOOT_DIR}/{mkdisk.LOADER_NAME}" in scenario.remove else loader or efi_dir / "nimbboot.efi"
    if scenario.network:
        return serve_volume(volume, efi_dir / "BOOTX64.efi", loader), cache_name
    disk = workdir / "disk.img"
    try:
        mkdisk.build_disk(disk, volume, efi_dir / "BOOTX64.efi", loader, disk_bytes=disk_bytes,
                          raw=raw, raw_guid=RESUME_PARTITION_GUID)
    except mkdisk.DiskError as error:
        raise OSError(str(error)) from error
    return disk, cache_name


def serve_volume(volume, platform, loader):
    """The staged volume as the directory served on a network boot: the
    platform as the boot file, the loader and platform.cfg at its root."""
    boot = volume / mkdisk.BOOT_DIR
    if (boot / mkdisk.CONFIG_NAME).is_file():
        (boot / mkdisk.CONFIG_NAME).rename(volume / mkdisk.CONFIG_NAME)
    for directory in (boot, boot.parent):
        if directory.is_dir() and not any(directory.iterdir()):
            directory.rmdir()
    shutil.copyfile(platform, volume / NET_BOOT_FILE)
    if loader is not None:
        shutil.copyfile(loader, volume / mkdisk.LOADER_NAME)
    return volume


def make_resume(resume, workdir, guest_dir, disk_bytes):
    """Writes the scenario's resume image onto a partition image with
    mkresume and the restart probe; returns its path and the platform.cfg
    keys that ask for the restart."""
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
    keys = dict(line.split("=", 1) for line in settings.read_text().splitlines() if "=" in line)
    return partition, keys


KEY_COPY = re.compile(r"platform: key copy at 0x([0-9a-f]+) type (\d+)")
KEY_TRACE = re.compile(r'resume trace kind=key address=0x([0-9a-f]+) where="([^"]*)"')


def check_key_trace(log):
    """Problems with the places where the restart probe found the key: each
    must be the firmware's (the runtime area the runtime data was moved to,
    the region it was copied from, or a copy that the platform layer found
    before the loader started); anything else the loader left behind."""
    firmware = {int(address, 16) for address, _ in KEY_COPY.findall(log)}
    problems = []
    for address, where in KEY_TRACE.findall(log):
        if where == "elsewhere" and int(address, 16) not in firmware:
            problems.append(f"key: the key's bytes at {address} are no copy of the firmware's")
    return problems


def check_boots(log, wanted):
    """Problems with the number of starts of the platform layer."""
    starts = log.count("platform: started")
    return [] if starts == wanted else [f"the machine started {starts} times, wanted {wanted}"]


RESUME_PARTITION = 2  # where make_resume puts the image
READ_LINE = re.compile(
    rf"platform: read partition={RESUME_PARTITION} offset=0x([0-9a-f]+) size=0x([0-9a-f]+) to=0x([0-9a-f]+)"
)


def check_resume_reads(log, expect):
    """Problems with the loader's DiskIO reads that the platform logged at
    the reset on the image's partition (the boot volume's file system reads
    through its own), against `expect` (ResumeReads): the header read first, then
    at most `after_header` reads, each inside the first stage behind a
    page-aligned header."""
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


class SerialFollower:
    """The lines of a serial log that QEMU is still writing, cleaned, as
    each one is completed."""

    def __init__(self, path):
        self.path, self.offset, self.pending = Path(path), 0, b""

    def lines(self, final=False):
        """The lines completed since the last call; with `final`, also an
        unfinished last line."""
        raw = self.path.read_bytes() if self.path.exists() else b""
        self.pending += raw[self.offset :]
        self.offset = len(raw)
        *complete, self.pending = self.pending.split(b"\n")
        if final and self.pending:
            complete.append(self.pending)
            self.pending = b""
        return [clean_log(line) for line in complete]


def second_path(path):
    return Path(path).with_name(Path(path).stem + "-2.png")


def boot(disk, workdir, timeout, screen_when=None, screen_path=None, echo=False, network=False, actions=(),
         second_shot=False, qemu_args=(), boots=1, extra=()):
    """Runs QEMU on `disk` until it ends, for at most `timeout` seconds. With
    `network`, `disk` is the directory served over TFTP and the machine
    boots from it (its packets go to workdir/net.pcap). With `screen_when`,
    takes a screenshot into `screen_path` over QMP as soon as a line of the
    serial log holds that text, and with `second_shot` another SPINNER_GAP
    later (second_path); `qemu_args` go behind QEMU's own, `extra` behind
    the accelerator; `actions` (Scenario.actions) are done in the same way;
    with `echo`, prints the cleaned serial log as it comes. With `boots`
    above 1, a reset starts the machine again on the same variable store,
    and the run ends when the platform layer starts once more than that.
    Returns the exit status (None: timed out or stopped), the cleaned log,
    the screenshot's path or None, and what went wrong with the screenshot,
    an action or the boots."""
    serial_log = workdir / "serial.log"
    qmp_socket = workdir / "qmp.sock" if screen_when or actions else None
    net = network_arguments(Path(disk).resolve(), workdir / "net.pcap") if network else None
    command = qemu_command(workdir, None if network else disk, serial_log, qmp_socket, net, reboot=boots > 1,
                           extra=extra) + list(qemu_args)
    machine = Machine(command, workdir / "qemu.log")
    deadline = time.monotonic() + timeout
    shot, trouble, pending, starts = None, [], list(actions), 0
    try:
        if screen_when or echo or actions or boots > 1:
            qmp = Qmp(qmp_socket, deadline, machine) if qmp_socket else None
            follower = SerialFollower(serial_log)
            while True:
                running = machine.poll() is None
                for line in follower.lines(final=not running):
                    if echo and line.strip():
                        print(line, flush=True)
                    if screen_when and shot is None and screen_when in line:
                        qmp.execute("screendump", filename=str(screen_path), format="png")
                        shot = screen_path
                        if second_shot:
                            time.sleep(SPINNER_GAP)
                            qmp.execute("screendump", filename=str(second_path(screen_path)), format="png")
                    for action in [action for action in pending if action[0] in line]:
                        pending.remove(action)
                        do_action(action[1], qmp, disk)
                    starts += line.startswith("platform: started")
                if starts > boots:
                    trouble.append(f"boots: the machine started more than {boots} times; stopped")
                    machine.kill()
                    break
                if not running or time.monotonic() > deadline:
                    break
                time.sleep(0.05)
            if qmp is not None:
                qmp.close()
    except (OSError, ConnectionError, RuntimeError, ValueError) as error:
        trouble.append(f"screen: QMP: {error}")
    finally:
        returncode = machine.wait(max(1.0, deadline - time.monotonic()))
    trouble += [f"action {action[1]!r} not done: {action[0]!r} never came" for action in pending]
    log = clean_log(serial_log.read_bytes()) if serial_log.exists() else ""
    return returncode, log, shot, trouble


def do_action(action, qmp, served):
    """One of Scenario.actions on the running machine."""
    if action[0] == "link-off":
        qmp.execute("set_link", name=NET_ID, up=False)
    elif action[0] == "truncate":
        os.truncate(Path(served) / action[1], action[2])
    else:
        raise ValueError(f"unknown action {action!r}")


def run_scenario(scenario, efi_dir, loader=None, timeout=None, guest_dir=GUEST_DIR):
    start = time.monotonic()
    workdir = Path(tempfile.mkdtemp(prefix=f"nimb-qemu-{scenario.name}-"))
    try:
        disk, cache_name = prepare(scenario, efi_dir, workdir, loader, guest_dir=guest_dir)
    except BaseException:
        shutil.rmtree(workdir, ignore_errors=True)
        raise
    limit = timeout or scenario.timeout
    screen = scenario.screen
    returncode, log, shot, trouble = boot(
        disk, workdir, limit, screen.when if screen else None, workdir / "screen.png" if screen else None,
        network=scenario.network, actions=scenario.actions,
        second_shot=bool(screen and screen.spinner == "turning"), boots=scenario.boots,
    )
    (workdir / "serial.txt").write_text(log)
    outcome = decode_exit(returncode, read_exit_codes())
    problems = check_report(log, outcome, scenario.status, scenario.memory, scenario.exit)
    problems += check_log(log, scenario.expect, scenario.forbid)
    if cache_name is not None and scenario.cache.looked_for:
        # The name that kcache gave the cache, from the boot device path the
        # disk tool computes, is the one the loader looks for.
        problems += check_log(log, [f"Looking for kernel cache file '{cache_name}'"])
    problems += check_console_modes(log, scenario.console_modes)
    if scenario.kernel is not None:
        problems += check_kernel(log, scenario.kernel, guest_dir)
    if scenario.capture:
        problems += check_capture(log, workdir / "net.pcap")
    if scenario.boots > 1:
        problems += [t for t in trouble if t.startswith("boots:")] + check_boots(log, scenario.boots)
        trouble = [t for t in trouble if not t.startswith("boots:")]
    problems += trouble
    problems += check_resume_reads(log, scenario.reads)
    if scenario.resume is not None:
        problems += check_key_trace(log)
    if screen is not None:
        picture, stray = check_screenshot(shot, screen)
        problems += picture + check_spinner([shot, shot and second_path(shot)], screen)
        if screen.alone:
            problems += stray
        else:
            for problem in stray:
                print(f"  {scenario.name}, not enforced: {problem}")
    if returncode is None:
        problems.insert(0, f"timed out after {limit} s")
    return Result(not problems, time.monotonic() - start, outcome, problems, log, workdir)


def report(scenario, result, show_log=False):
    if result.passed:
        shutil.rmtree(result.workdir, ignore_errors=True)
        print(f"PASS {scenario.name} ({result.outcome.name}, {result.seconds:.1f} s)")
        if show_log:
            print(result.log.rstrip())
        return
    print(f"FAIL {scenario.name} ({result.outcome.name}, {result.seconds:.1f} s)")
    for problem in result.problems:
        print(f"  {problem}")
    print(f"--- serial log ({result.workdir / 'serial.log'}, cleaned) ---")
    print(result.log.rstrip())
    qemu_log = (result.workdir / "qemu.log").read_text(errors="replace").strip()
    if qemu_log:
        print("--- qemu ---")
        print(qemu_log)
    # Once more behind the long log, where a reader of the output looks first.
    print(f"--- {scenario.name}: {len(result.problems)} expectation(s) failed ---")
    for problem in result.problems:
        print(f"  {problem}")
    print(f"--- files kept in {result.workdir} ---")


# --- QMP and the demo -----------------------------------------------------------------


class Qmp:
    """A QMP connection: commands as JSON lines, answers read past events."""

    def __init__(self, path, deadline, machine=None):
        while True:
            try:
                self.sock = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
                self.sock.connect(str(path))
                break
            except (FileNotFoundError, ConnectionRefusedError):
                self.sock.close()
                if time.monotonic() > deadline or (machine is not None and machine.poll() is not None):
                    raise
                time.sleep(0.1)
        self.sock.settimeout(max(1.0, deadline - time.monotonic()))
        self.stream = self.sock.makefile("rwb")
        self._read()  # greeting
        self.execute("qmp_capabilities")

    def _read(self):
        line = self.stream.readline()
        if not line:
            raise ConnectionError("QMP connection closed")
        return json.loads(line)

    def execute(self, command, **arguments):
        message = {"execute": command}
        if arguments:
            message["arguments"] = arguments
        self.stream.write(json.dumps(message).encode() + b"\n")
        self.stream.flush()
        while True:
            answer = self._read()
            if "return" in answer:
                return answer["return"]
            if "error" in answer:
                raise RuntimeError(f"QMP {command}: {answer['error']}")

    def close(self):
        self.stream.close()
        self.sock.close()


# The demo's volume: the reference kernel under its default name with the
# test driver bundles, and a kernel cache that kcache made of both, booted in
# graphics mode; the kernel holds the machine a while after its report.
DEMO = Scenario(
    "demo",
    config={"console": "graphics", "options": "guest.hold=4"},
    files=kernel_file(),
    cache=KernelCache(args=("--drivers", f"volume:{EXTENSIONS_DIR}")),
)
DEMO_SCREEN_EXPECT = ScreenExpect(when="kernel: result", picture="logo")
# The network's demo: the same kernel, with its driver package, served over
# TFTP to a machine without a disk.
NET_DEMO = NetScenario("demo-net", config={"options": "guest.hold=4"}, files=net_kernel_files(), timeout=150.0)
NET_DEMO_SCREEN = REPO / "out" / "demo-net-screen.png"


def demo(efi_dir, loader=None, guest_dir=GUEST_DIR, timeout=120.0, network=False):
    """Boots the reference kernel, prints the serial log as it comes, takes
    a screenshot once the kernel has reported (while it holds the machine)
    and lets the kernel power off. With `network`, the machine has no disk
    and boots over QEMU's TFTP from a directory of the same files. True when
    the kernel passed and the screenshot was taken."""
    workdir = Path(tempfile.mkdtemp(prefix="nimb-qemu-demo-"))
    scenario, screen = (NET_DEMO, NET_DEMO_SCREEN) if network else (DEMO, DEMO_SCREEN)
    disk, cache_name = prepare(scenario, efi_dir, workdir, loader, guest_dir=guest_dir)
    if network:
        print(f"demo: serving {disk} over TFTP")
    screen.parent.mkdir(parents=True, exist_ok=True)
    if screen.exists():
        screen.unlink()
    returncode, log, shot, trouble = boot(
        disk, workdir, timeout, DEMO_SCREEN_EXPECT.when, screen.resolve(), echo=True, network=network
    )
    outcome = decode_exit(returncode, read_exit_codes())
    kernel = parse_kernel_report(log)
    print()
    if kernel.result is None:
        print(f"demo: the kernel gave no result (exit {outcome.name})")
    else:
        passed, checks, failed = kernel.result
        print(f"demo: kernel {'pass' if passed else 'FAIL'}: {checks} checks, {failed} failed (exit {outcome.name})")
        for check in kernel.failed_checks():
            print(f"demo:   check {check.name} FAIL {check.detail}")
    looked = f"Looking for kernel cache file '{cache_name}'" in log
    if network:
        print(f"demo: booted over the network, drivers from {kernel.drivers_from}")
    elif kernel.drivers_from == "cache" and looked:
        print(f"demo: booted from the kernel cache {cache_name}, made by kcache, with "
              f"{len(kernel.drivers)} drivers prelinked: {', '.join(d[0] for d in kernel.drivers)}")
    else:
        print(f"demo: NOT booted from the kernel cache {cache_name} (drivers from {kernel.drivers_from}, "
              f"looked for it: {looked})")
    for problem in trouble:
        print(f"demo: {problem}")
    if shot is None:
        print(f"demo: no screenshot; files kept in {workdir}")
        return False
    if not network:
        DOCS_SCREEN.parent.mkdir(parents=True, exist_ok=True)
        shutil.copyfile(shot, DOCS_SCREEN)
    picture, stray = check_screenshot(shot, DEMO_SCREEN_EXPECT)
    if picture:
        print("demo: the screen is not the logo centred on grey:")
    else:
        print("demo: the screen shows the logo centred on the grey background")
    if stray:
        print("demo: " + ("and " if not picture else "") + "more than the logo is on the screen:")
    for problem in picture + stray:
        print(f"demo:   {problem}")
    print(f"demo: screenshot in {screen}" + ("" if network else f" (and {DOCS_SCREEN})"))
    ok = outcome.name == "KernelPass" and (network or kernel.drivers_from == "cache")
    if ok:
        shutil.rmtree(workdir, ignore_errors=True)
    else:
        print(f"demo: files kept in {workdir}")
    return ok


# --- command line ---------------------------------------------------------------------


def main(argv=None):
    global TOOLS_DIR
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--efi-dir", default=str(REPO / "build" / "efi"), help="where BOOTX64.efi and nimbboot.efi are")
    parser.add_argument("--loader", help="another EFI program to start in place of nimbboot.efi")
    parser.add_argument("--guest-dir", default=str(GUEST_DIR), help="where the reference kernel's files are")
    parser.add_argument("--tools-dir", default=str(TOOLS_DIR), help="where the host tools (kcache) are")
    parser.add_argument("--scenario", action="append", help="run this scenario (repeatable; default all)")
    parser.add_argument("--timeout", type=float, help="seconds per run, instead of the scenario's own")
    parser.add_argument("--show-log", action="store_true", help="print the serial log of passing runs too")
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
        return 0 if demo(args.efi_dir, args.loader, args.guest_dir, network=args.net) else 1
    names = args.scenario or list(SCENARIOS)
    unknown = [name for name in names if name not in SCENARIOS]
    if unknown:
        parser.error(f"unknown scenario(s): {', '.join(unknown)}")
    failed = 0
    for name in names:
        try:
            result = run_scenario(SCENARIOS[name], args.efi_dir, args.loader, args.timeout, args.guest_dir)
        except (OSError, subprocess.CalledProcessError) as error:
            detail = getattr(error, "stderr", None) or b""
            print(f"FAIL {name}: {error} {detail.decode(errors='replace').strip()}")
            failed += 1
            continue
        report(SCENARIOS[name], result, args.show_log)
        failed += not result.passed
    return 1 if failed else 0


if __name__ == "__main__":
    sys.exit(main())
