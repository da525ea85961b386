"""Tests of the harness's own logic: log cleaning, expectation checks, exit
codes, the configuration file it writes, the kernel's report and the
screenshots. No QEMU needed."""

import re
import struct
import tempfile
import unittest
import zlib
from pathlib import Path

import harness
from scenarios import (
    BASE_CONFIG,
    mkdisk,
    SCENARIOS,
    AtLeast,
    DriverExpect,
    KernelExpect,
    ResumeReads,
    Scenario,
    ScreenExpect,
    quoted,
    text,
    ucs2,
)

ABORTED_SAME = harness.Outcome("AbortedSame", "EFI_ABORTED", "same")
REPORT = (
    "platform: loader returned 0x8000000000000015 (EFI_ABORTED)\n"
    "platform: memory same\n"
    "platform: exit code 0x10\n"
)


class CleanLog(unittest.TestCase):
    def test_rows(self):
        rows = [
            ("CR LF", b"a\r\nb\r\n", "a\nb\n"),
            ("colour and position", b"\x1b[0m\x1b[37m\x1b[40mText\x1b[24;1H!", "Text!"),
            ("private mode", b"\x1b[=3h\x1b[?25lHi", "Hi"),
            ("character set and two-character escapes", b"\x1b(B\x1bcX\x1b7Y", "XY"),
            ("other control characters", b"A\x08\x07\x00B\tC", "AB\tC"),
            ("bad UTF-8 survives", b"k\xffz", "k\ufffdz"),
        ]
        for name, raw, expected in rows:
            with self.subTest(name):
                self.assertEqual(harness.clean_log(raw), expected)


class CheckLog(unittest.TestCase):
    def test_rows(self):
        log = "one\ntwo\nthree\n"
        rows = [
            ("in order", ("one", "three"), (), 0),
            ("out of order", ("three", "one"), (), 1),
            ("repeated text needs two occurrences", ("one", "one"), (), 1),
            ("missing", ("four",), (), 1),
            ("forbidden present", (), ("two",), 1),
            ("forbidden absent", (), ("four",), 0),
        ]
        for name, expect, forbid, count in rows:
            with self.subTest(name):
                self.assertEqual(len(harness.check_log(log, expect, forbid)), count)

    def test_console_mode_rows(self):
        log = "a\nplatform: console mode text\nb\nplatform: console mode graphics\n"
        rows = [
            ("not checked", log, None, 0),
            ("all, in order", log, ("text", "graphics"), 0),
            ("one missing", log, ("text",), 1),
            ("out of order", log, ("graphics", "text"), 1),
            ("none wanted, none asked", "a\n", (), 0),
            ("none wanted, some asked", log, (), 1),
            ("a refused change counts", "platform: console mode 7 refused (EFI_INVALID_PARAMETER)\n", ("7",), 0),
        ]
        for name, text, wanted, count in rows:
            with self.subTest(name):
                self.assertEqual(len(harness.check_console_modes(text, wanted)), count)

    def test_report_rows(self):
        changed = harness.Outcome("AbortedChanged", "EFI_ABORTED", "changed")
        missing = harness.Outcome("LoaderMissing")
        rows = [
            ("as wanted", REPORT, ABORTED_SAME, "EFI_ABORTED", "same", None, 0),
            ("exit code disagrees on memory", REPORT, changed, "EFI_ABORTED", "same", None, 1),
            ("wrong status", REPORT, ABORTED_SAME, "EFI_SUCCESS", "same", None, 2),
            ("any other status", REPORT, ABORTED_SAME, "other", "same", None, 0),
            ("no report", "", ABORTED_SAME, "EFI_ABORTED", "same", None, 2),
            ("two reports", REPORT + REPORT, ABORTED_SAME, "EFI_ABORTED", "same", None, 2),
            ("platform failure wanted", "", missing, "EFI_ABORTED", "same", "LoaderMissing", 0),
            ("platform failure not wanted", "", missing, "EFI_ABORTED", "same", None, 3),
            ("timeout", "", harness.Outcome("Timeout"), "EFI_ABORTED", "same", "LoaderMissing", 1),
        ]
        for name, log, outcome, status, memory, exit_name, count in rows:
            with self.subTest(name):
                problems = harness.check_report(log, outcome, status, memory, exit_name)
                self.assertEqual(len(problems), count, problems)


class ExitCodes(unittest.TestCase):
    def test_header_table(self):
        codes = harness.read_exit_codes()
        by_name = {outcome.name: (code, outcome) for code, outcome in codes.items()}
        self.assertEqual(
            set(by_name),
            {
                "AbortedSame", "AbortedChanged", "SuccessSame", "SuccessChanged", "OtherSame", "OtherChanged",
                "ConfigInvalid", "LoaderMissing", "LoadImageFailed", "PlatformFailed",
                "KernelPass", "KernelFail",
            },
        )  # fmt: skip
        self.assertEqual(by_name["AbortedSame"][1], ABORTED_SAME)
        self.assertEqual(by_name["OtherChanged"][1].status, "other")
        self.assertIsNone(by_name["LoaderMissing"][1].status)
        self.assertEqual(by_name["KernelPass"][1], harness.Outcome("KernelPass"))
        self.assertTrue(all(code < 0x80 for code in codes))

    def test_merged_headers_rows(self):
        platform = "constexpr UINT8 kExitA = 0x10;\nconstexpr UINT8 kExitB = 0x11;\n"
        rows = [
            ("apart", "constexpr UINT8 kExitC = 0x31;\n", {0x10: "A", 0x11: "B", 0x31: "C"}),
            ("code in both", "constexpr UINT8 kExitC = 0x11;\n", None),
            ("name in both", "constexpr UINT8 kExitA = 0x31;\n", None),
            ("second header empty", "// nothing\n", None),
        ]
        for name, kernel, expected in rows:
            with self.subTest(name), tempfile.TemporaryDirectory() as directory:
                first, second = Path(directory) / "a.h", Path(directory) / "b.h"
                first.write_text(platform)
                second.write_text(kernel)
                if expected is None:
                    with self.assertRaises(ValueError):
                        harness.read_exit_codes((first, second))
                else:
                    codes = harness.read_exit_codes((first, second))
                    self.assertEqual({code: outcome.name for code, outcome in codes.items()}, expected)

    def test_decode_rows(self):
        codes = {0x10: ABORTED_SAME, 0x21: harness.Outcome("LoaderMissing"), 0x31: harness.Outcome("KernelPass")}
        rows = [
            ("debug exit", 0x21, "AbortedSame"),
            ("the kernel's code", 0x63, "KernelPass"),
            ("platform failure", 0x43, "LoaderMissing"),
            ("plain power-off", 0, "PoweredOff"),
            ("time out", None, "Timeout"),
            ("killed", -9, "Signal9"),
            ("unknown code", 0x7F, "QemuExit127"),
            ("QEMU's own error", 1, "QemuExit1"),
        ]
        for name, returncode, expected in rows:
            with self.subTest(name):
                self.assertEqual(harness.decode_exit(returncode, codes).name, expected)

    def test_duplicate_code_refused(self):
        with tempfile.TemporaryDirectory() as directory:
            header = Path(directory) / "exitcodes.h"
            header.write_text("constexpr UINT8 kExitA = 0x10;\nconstexpr UINT8 kExitB = 0x10;\n")
            with self.assertRaises(ValueError):
                harness.read_exit_codes(header)


class Config(unittest.TestCase):
    def test_value_rows(self):
        rows = [
            ("plain", "graphics", "graphics"),
            ("number", 3, "3"),
            ("inner blanks stay plain", "a b", "a b"),
            ("leading blanks quoted", "  -v", '"  -v"'),
            ("backslashes of a plain path", "\\EFI\\BOOT\\x.efi", "\\EFI\\BOOT\\x.efi"),
            ("escapes when quoted", '\t"x"\\\n', '"\\t\\"x\\"\\\\\\n"'),
            ("leading quote quoted", '"x', '"\\"x"'),
        ]
        for name, value, expected in rows:
            with self.subTest(name):
                self.assertEqual(harness.config_value(value), expected)
        self.assertEqual(harness.render_config({"console": "text", "hold": 3}), "console=text\nhold=3\n")

    def test_scenario_config_rows(self):
        base = dict(BASE_CONFIG)
        rows = [
            ("base alone", Scenario("a"), None, base),
            ("scenario over base, in base's place",
             Scenario("a", config={"datahub.Model": "X", "keys": "shift"}), None,
             {**base, "datahub.Model": "X", "keys": "shift"}),
            ("override last", Scenario("a", config={"hold": 1}), {"hold": 3}, {**base, "hold": 3}),
            ("without base", Scenario("a", base_config=False, config={"hold": 1}), None, {"hold": 1}),
            ("without anything", Scenario("a", base_config=False), None, {}),
        ]  # fmt: skip
        for name, scenario, override, expected in rows:
            with self.subTest(name):
                config = harness.scenario_config(scenario, override)
                self.assertEqual(config, expected)
                self.assertEqual(list(config), list(expected))
        self.assertEqual(BASE_CONFIG, base, "the base configuration was changed")

    def test_scenarios_are_well_formed(self):
        codes = {outcome.name for outcome in harness.read_exit_codes().values()}
        for scenario in SCENARIOS.values():
            with self.subTest(scenario.name):
                self.assertIn(scenario.memory, ("same", "changed"))
                self.assertIn(scenario.status, ("EFI_ABORTED", "EFI_SUCCESS", "other"))
                if scenario.exit is not None:
                    self.assertIn(scenario.exit, codes)
                for mode in scenario.console_modes or ():
                    self.assertIn(mode, ("text", "graphics"))
                if scenario.kernel is not None:
                    self.assertIn(scenario.kernel.result, ("pass", "fail"))
                if scenario.screen is not None:
                    self.assertIn(scenario.screen.picture, (None, *harness.read_artwork()))


# A boot's report as the kernel prints it, cut short: the loader's last
# messages, then the kernel's lines.
KERNEL_LOG = """\
Loading 'nimb_kernel'...
.....
root device uuid is '0FAB1E5D-3C2B-4A19-8E7F-60C5D4B3A291'

kernel: start
kernel: entry eax=0x10a000 ebx=0x10a000 ecx=0xc0000080
kernel: entry cs=0x8 ds=0x10
kernel: check entry-eax-ebx ok eax=0x10a000 ebx=0x10a000
kernel: check bootargs-address ok 0x10a000
kernel: bootargs revision=4
kernel: bootargs commandLine="foo=1 q=\\"a b\\" \\\\ \\x01"
kernel: bootargs videoDisplayMode=1
kernel: bootargs runtimePageCount=0x788
kernel: tree / (3 properties, 2 children)
kernel: tree   name = "/"
kernel: tree   compatible = "ACPI"
kernel: tree   chosen/ (4 properties, 1 child)
kernel: tree     name = "chosen"
kernel: tree     boot-uuid = "0FAB1E5D-3C2B-4A19-8E7F-60C5D4B3A291"
kernel: tree     boot-file = "nimb_kernel"
kernel: tree     memory-map/ (2 properties, 0 children)
kernel: tree       name = "memory-map"
kernel: tree       BootCLUT = <00 b0 10 00 00 03 00 00> (address 0x10b000, length 0x300)
kernel: tree   efi/ (2 properties, 1 child)
kernel: tree     name = "efi"
kernel: tree     firmware-abi = "EFI64"
kernel: tree     platform/ (2 properties, 0 children)
kernel: tree       name = "platform"
kernel: tree       Model = u"QEMU1,1"
kernel: check tree-walk ok 5 nodes, 11 properties, 0x200 of 0x200 bytes
kernel: range BootCLUT address=0x10b000 length=0x300
kernel: driver "com.x.A" from=loader address=0x120000 plist=0x6 code=0x3 sum=0x24d0127
kernel: driver "com.x.B" from=loader address=0x121000 plist=0x1 code=0x0 sum=0x1
kernel: package address=0x122000 length=0x3 sum=0x24d0127
kernel: drivers from=loader blocks=2 package=1
kernel: memmap address=0x112000 size=0x1950 descriptorSize=48 descriptorVersion=1 descriptors=135
kernel: memmap type EfiLoaderData count=3 pages=0x1c
kernel: efi systemTable=0x315018 revision=0x20046
kernel: result pass (3 checks, 0 failed)
kernel: hold 4 s
"""


class KernelReport(unittest.TestCase):
    def test_unquote_rows(self):
        rows = [
            ("plain", '"abc" rest', ("abc", " rest")),
            ("escaped quote and backslash", r'"a\"b\\c"', ('a"b\\c', "")),
            ("byte escape", r'"\x01\xc3\xa9"', ("\x01\xc3\xa9", "")),
            ("empty", '""', ("", "")),
        ]
        for name, value, expected in rows:
            with self.subTest(name):
                self.assertEqual(harness.unquote(value), expected)
                self.assertEqual(quoted(expected[0].encode("latin-1")), value[: len(value) - len(expected[1])])
        for broken in ('"abc', "abc"):
            with self.subTest(broken), self.assertRaises(ValueError):
                harness.unquote(broken)

    def test_parse(self):
        report = harness.parse_kernel_report(KERNEL_LOG)
        self.assertEqual(report.starts, 1)
        self.assertEqual(report.entry, {"eax": 0x10A000, "ebx": 0x10A000, "ecx": 0xC0000080, "cs": 8, "ds": 0x10})
        self.assertEqual([(c.name, c.ok) for c in report.checks],
                         [("entry-eax-ebx", True), ("bootargs-address", True), ("tree-walk", True)])  # fmt: skip
        self.assertEqual(report.bootargs["commandLine"], 'foo=1 q="a b" \\ \x01')
        self.assertEqual(report.bootargs["runtimePageCount"], 0x788)
        self.assertEqual(
            report.tree,
            {
                "/": {"name": '"/"', "compatible": '"ACPI"'},
                "/chosen": {"name": '"chosen"', "boot-uuid": text("0FAB1E5D-3C2B-4A19-8E7F-60C5D4B3A291"),
                            "boot-file": text("nimb_kernel")},
                "/chosen/memory-map": {"name": '"memory-map"',
                                       "BootCLUT": "<00 b0 10 00 00 03 00 00> (address 0x10b000, length 0x300)"},
                "/efi": {"name": '"efi"', "firmware-abi": text("EFI64")},
                "/efi/platform": {"name": '"platform"', "Model": ucs2("QEMU1,1")},
            },
        )  # fmt: skip
        self.assertEqual(report.tree_lines[3], "  chosen/ (4 properties, 1 child)")
        self.assertEqual(report.ranges, {"BootCLUT": (0x10B000, 0x300)})
        self.assertEqual(report.memmap_types, {"EfiLoaderData": (3, 0x1C)})
        self.assertEqual(len(report.memmap), 2)
        self.assertEqual(report.efi, {"systemTable": 0x315018, "revision": 0x20046})
        self.assertEqual(report.result, (True, 3, 0))
        self.assertEqual(report.hold, 4)
        self.assertEqual(report.drivers, [("com.x.A", "loader", 6, 3, 0x24D0127), ("com.x.B", "loader", 1, 0, 1)])
        self.assertEqual((report.package, report.drivers_from), ((3, 0x24D0127), "loader"))
        self.assertEqual(report.unknown, [])

    def test_check_rows(self):
        good = KernelExpect(
            bootargs={"commandLine": re.compile(r"foo=1 .*"), "videoDisplayMode": 1,
                      "runtimePageCount": AtLeast(2)},
            tree={"/chosen": {"boot-file": text("nimb_kernel")}, "/efi/platform": {"Model": ucs2("QEMU1,1")},
                  "/chosen/memory-map": {}},
            ranges={"BootCLUT": 0x300},
        )  # fmt: skip
        drivers = {"com.x.A": DriverExpect("plist", b"abc"), "com.x.B": DriverExpect("")}
        failing_check = KERNEL_LOG.replace("check tree-walk ok", "check tree-walk FAIL").replace(
            "(3 checks, 0 failed)", "(3 checks, 1 failed)"
        ).replace("result pass", "result fail")
        rows = [
            ("as wanted", KERNEL_LOG, good, []),
            ("no kernel", "Loading 'nimb_kernel'...\n", good, ["no report"]),
            ("started twice", "kernel: start\n" + KERNEL_LOG, good, ["started 2 times"]),
            ("broke off", KERNEL_LOG.split("kernel: result")[0], good, ["no result line"]),
            ("a check failed", failing_check, good, ["check tree-walk FAIL"]),
            ("a failure wanted", failing_check, KernelExpect(result="fail"), []),
            ("a failure wanted, none came", KERNEL_LOG, KernelExpect(result="fail"), ["every check passed"]),
            ("result disagrees with the checks", KERNEL_LOG.replace("(3 checks", "(4 checks"), good,
             ["result line says"]),
            ("command line", KERNEL_LOG.replace("foo=1 q", "foo=2 q"), good, ["bootargs commandLine"]),
            ("number", KERNEL_LOG, KernelExpect(bootargs={"videoDisplayMode": 2}), ["bootargs videoDisplayMode=1"]),
            ("too small", KERNEL_LOG, KernelExpect(bootargs={"runtimePageCount": AtLeast(0x789)}),
             ["runtimePageCount=1928, wanted >= 1929"]),
            ("field not reported", KERNEL_LOG, KernelExpect(bootargs={"videoWidth": 1}), ["videoWidth not reported"]),
            ("text where UCS-2 is wanted", KERNEL_LOG.replace('u"QEMU1,1"', '"QEMU1,1"'), good, ["Model"]),
            ("node missing", KERNEL_LOG, KernelExpect(tree={"/efi/runtime-services": {}}),
             ["no node /efi/runtime-services"]),
            ("property in another node", KERNEL_LOG, KernelExpect(tree={"/efi": {"Model": ucs2("QEMU1,1")}}),
             ["/efi has no property Model"]),
            ("range missing", KERNEL_LOG, KernelExpect(ranges={"Pict-FailedBoot": None}), ["no range Pict-FailedBoot"]),
            ("range length", KERNEL_LOG, KernelExpect(ranges={"BootCLUT": 0x301}), ["length 0x300, wanted 0x301"]),
            ("tree that the loader printed otherwise", KERNEL_LOG.replace("uuid is '0FAB", "uuid is '1FAB"), good,
             ["boot-uuid"]),
            ("broken tree", KERNEL_LOG.replace("kernel: range", "kernel: tree error truncated at 0x10\nkernel: range"),
             good, ["tree error truncated"]),
            ("line of no known kind", KERNEL_LOG + "kernel: frobnicate 1\n", good, ["no known kind"]),
            ("drivers as wanted", KERNEL_LOG, KernelExpect(drivers_from="loader", drivers=drivers, package=b"abc"), []),
            ("drivers from elsewhere", KERNEL_LOG, KernelExpect(drivers_from="cache"), ["drivers from loader"]),
            ("drivers in another order", KERNEL_LOG, KernelExpect(drivers=dict(reversed(drivers.items()))),
             ["kernel: drivers"]),
            ("driver code differs", KERNEL_LOG, KernelExpect(drivers={**drivers, "com.x.A": DriverExpect("plist", b"abd")}),
             ["kernel: drivers"]),
            ("package differs", KERNEL_LOG, KernelExpect(package=b"abcd"), ["package (length, sum)"]),
        ]  # fmt: skip
        for name, log, expect, wanted in rows:
            with self.subTest(name):
                problems = harness.check_kernel(log, expect)
                self.assertEqual(len(problems), len(wanted), problems)
                for problem, part in zip(problems, wanted):
                    self.assertIn(part, problem)


class DiskTool(unittest.TestCase):
    def test_time_rows(self):
        rows = [
            ("year boundary", "2006-12-31 23:59:59.500000000"),
            ("leap day", "2008-02-29 00:00:00.000000001"),
            ("before 1970", "1969-12-31 23:59:59.999999999"),
        ]
        for name, text in rows:
            with self.subTest(name):
                self.assertEqual(mkdisk.efi_time_text(mkdisk.parse_time(text)), text)
        self.assertEqual(mkdisk.parse_time("1970-01-01 00:00:01.5"), 1_500_000_000)
        self.assertRaises(ValueError, mkdisk.parse_time, "2006-12-31T23:59:59")

    def test_times_table_and_boot_path(self):
        with tempfile.TemporaryDirectory() as directory:
            volume = Path(directory)
            (volume / "System" / "Library").mkdir(parents=True)
            (volume / "nimb_kernel").write_bytes(b"k")
            mkdisk.set_time(volume / "nimb_kernel", mkdisk.parse_time("2006-12-31 23:59:59.5"))
            lines = mkdisk.times_table(volume).splitlines()
        self.assertIn("2006-12-31 23:59:59.500000000 \\nimb_kernel", lines)
        self.assertEqual([line.split(" ", 2)[2] for line in lines[1:]],
                         ["\\System", "\\System\\Library", "\\nimb_kernel"])  # fmt: skip
        path = mkdisk.boot_device_path(disk_bytes=64 << 20)
        self.assertEqual((len(path), path[-4:], path[28:30]), (74, b"\x7f\xff\x04\x00", b"\x04\x01"))


class Resume(unittest.TestCase):
    def test_reads_rows(self):
        header = "platform: read partition=2 offset=0x10000 size=0x200 to=0x1de86d18 status=0x0\n"
        inside = "platform: read partition=2 offset=0x10200 size=0xfe00 to=0x5000200 status=0x0\n"
        beyond = "platform: read partition=2 offset=0x20000 size=0x100000 to=0x5010000 status=0x0\n"
        unaligned = "platform: read partition=2 offset=0x10200 size=0x100 to=0x5000300 status=0x0\n"
        volume = "platform: read partition=1 offset=0x108400 size=0x10000 to=0x1de12418 status=0x0\n"
        rows = [
            (header, ResumeReads(), []),
            (volume + header, ResumeReads(), []),
            (header + inside, ResumeReads(), ["1 reads after the header"]),
            (header + inside, ResumeReads(after_header=None), []),
            (header + inside + beyond, ResumeReads(after_header=None), ["leave the first stage"]),
            (header + unaligned, ResumeReads(after_header=None), ["no page + 512"]),
            (inside, ResumeReads(), ["not the 512-byte header"]),
            ("", None, []),
        ]
        for log, expect, wanted in rows:
            problems = harness.check_resume_reads(log, expect)
            self.assertEqual(len(problems), len(wanted), (log, problems))
            for problem, words in zip(problems, wanted):
                self.assertIn(words, problem)

    def test_key_trace_rows(self):
        firmware = "platform: key copy at 0x1eb20072 type 6\n"
        trace = 'kernel: resume trace kind=key address=0x{} where="{}"\n'
        rows = [
            (firmware + trace.format("1eb20072", "elsewhere"), 0),
            (firmware + trace.format("431072", "runtime area"), 0),
            (firmware + trace.format("1e000000", "runtime region copied to the area"), 0),
            (firmware + trace.format("1fe9fb00", "elsewhere"), 1),
            (trace.format("1eb20072", "elsewhere"), 1),
        ]
        for log, count in rows:
            self.assertEqual(len(harness.check_key_trace(log)), count, log)

    def test_boots(self):
        self.assertEqual(harness.check_boots("platform: started\nplatform: started\n", 2), [])
        self.assertEqual(len(harness.check_boots("platform: started\n", 2)), 1)


class SerialFollower(unittest.TestCase):
    def test_lines_come_whole(self):
        with tempfile.TemporaryDirectory() as directory:
            path = Path(directory) / "serial.log"
            follower = harness.SerialFollower(path)
            self.assertEqual(follower.lines(), [])
            steps = [
                (b"one\r\ntw", False, ["one"]),
                (b"o\x1b[0m\r\n", False, ["two"]),
                (b"three", False, []),
                (b"", True, ["three"]),
                (b"", True, []),
            ]
            for index, (more, final, expected) in enumerate(steps):
                with self.subTest(index):
                    with open(path, "ab") as log:
                        log.write(more)
                    self.assertEqual(follower.lines(final), expected)


# --- screenshots ---------------------------------------------------------------------

GREY = (191, 191, 191)


def png(width, height, pixel, filters=(0,), alpha=False):
    """A PNG file of `pixel(x, y)`; row y uses filter filters[y % len]."""
    step = 4 if alpha else 3
    raw, previous = bytearray(), bytes(width * step)
    for y in range(height):
        row = bytes(v for x in range(width) for v in (*pixel(x, y), 255)[:step])
        kind = filters[y % len(filters)]
        out = bytearray()
        for i, value in enumerate(row):
            a = row[i - step] if i >= step else 0
            b = previous[i]
            c = previous[i - step] if i >= step else 0
            if kind == 1:
                value -= a
            elif kind == 2:
                value -= b
            elif kind == 3:
                value -= (a + b) // 2
            elif kind == 4:
                p = a + b - c
                pa, pb, pc = abs(p - a), abs(p - b), abs(p - c)
                value -= a if pa <= pb and pa <= pc else b if pb <= pc else c
            out.append(value & 0xFF)
        raw += bytes([kind]) + out
        previous = row

    def chunk(kind, body):
        return struct.pack(">I", len(body)) + kind + body + struct.pack(">I", zlib.crc32(kind + body))

    header = struct.pack(">IIBBBBB", width, height, 8, 6 if alpha else 2, 0, 0, 0)
    return harness.PNG_SIGNATURE + chunk(b"IHDR", header) + chunk(b"IDAT", zlib.compress(bytes(raw))) + chunk(
        b"IEND", b""
    )


def screen(width, height, picture=None, at=None, extra=()):
    """An Image of the grey screen with the 128 x 128 `picture` (list of
    pixels) at `at` (default: centred) and single `extra` pixels ((x, y, rgb))."""
    rows = [bytearray(bytes(GREY) * width) for _ in range(height)]
    if picture is not None:
        x0, y0 = at or ((width - 128) >> 1, (height - 128) >> 1)
        for i, rgb in enumerate(picture):
            x, y = x0 + i % 128, y0 + i // 128
            if 0 <= x < width and 0 <= y < height:
                rows[y][3 * x : 3 * x + 3] = bytes(rgb)
    for x, y, rgb in extra:
        rows[y][3 * x : 3 * x + 3] = bytes(rgb)
    return harness.Image(width, height, [bytes(row) for row in rows])


class Screen(unittest.TestCase):
    def test_png_rows(self):
        def pixel(x, y):
            # Steep ramps, and flat patches where the predictors tie.
            if x >= 4:
                return (x // 6 * 40, y // 3 * 50, 7)
            return ((x * 37 + y * 11) & 0xFF, (x * y) & 0xFF, (255 - x * 5 - y) & 0xFF)

        rows = [
            ("no filter", (0,), False),
            ("sub", (1,), False),
            ("up", (2,), False),
            ("average", (3,), False),
            ("paeth", (4,), False),
            ("all mixed", (4, 0, 3, 1, 2), False),
            ("alpha dropped", (4, 1), True),
        ]
        for name, filters, alpha in rows:
            with self.subTest(name):
                image = harness.read_png(png(13, 6, pixel, filters, alpha))
                self.assertEqual((image.width, image.height), (13, 6))
                self.assertEqual([image.pixel(x, y) for y in range(6) for x in range(13)],
                                 [pixel(x, y) for y in range(6) for x in range(13)])  # fmt: skip
        for name, data in [
            ("not a PNG", b"GIF89a"),
            ("palette", png(2, 2, lambda x, y: GREY).replace(b"\x08\x02\x00\x00\x00", b"\x08\x03\x00\x00\x00")),
        ]:
            with self.subTest(name), self.assertRaises(ValueError):
                harness.read_png(data)

    def test_check_rows(self):
        artwork = harness.read_artwork()
        logo, failure = artwork["logo"], artwork["failure"]
        self.assertEqual(len(logo), 128 * 128)
        self.assertEqual(logo[0], GREY, "the logo's corner is the background")
        swapped = [(b, g, r) for r, g, b in logo]
        expect = ScreenExpect("x", picture="logo")
        rows = [
            ("logo in place", screen(1280, 800, logo), expect, 0, 0),
            ("odd sizes", screen(1025, 769, logo), expect, 0, 0),
            ("one pixel right", screen(1280, 800, logo, at=(577, 336)), expect, 1, 0),
            ("one pixel left", screen(1280, 800, logo, at=(575, 336)), expect, 1, 0),
            ("two pixels right, out of centre", screen(1280, 800, logo, at=(578, 336)), expect, 1, 1),
            ("one row off, out of centre", screen(1280, 800, logo, at=(576, 337)), expect, 1, 1),
            ("far off", screen(1280, 800, logo, at=(0, 0)), expect, 1, 1),
            ("red and blue swapped", screen(1280, 800, swapped), expect, 1, 0),
            ("the other picture", screen(1280, 800, failure), expect, 1, 0),
            ("nothing drawn", screen(1280, 800), expect, 1, 0),
            ("text beside the logo", screen(1280, 800, logo, extra=[(240, 219, (0, 0, 0))]), expect, 0, 2),
            ("a dot below the logo", screen(1280, 800, logo, extra=[(640, 470, (0, 0, 0))]), expect, 0, 1),
            ("any picture, centred", screen(1280, 800, failure), ScreenExpect("x"), 0, 0),
            ("any picture, none there", screen(1280, 800), ScreenExpect("x"), 1, 0),
            ("background not grey", harness.Image(4, 4, [bytes(12)] * 4), expect, 1, 0),
        ]
        for name, image, wanted, picture_count, stray_count in rows:
            with self.subTest(name):
                picture, stray = harness.check_screen(image, wanted, artwork)
                self.assertEqual((len(picture), len(stray)), (picture_count, stray_count), (picture, stray))


if __name__ == "__main__":
    unittest.main()
