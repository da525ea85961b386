"""Tests of the harness's checks that gate the loader: the platform's
report and exit code, the serial log, the kernel's report, the screen and
the resume reads. No QEMU needed."""

import random
import re
import unittest

import harness
from scenarios import AtLeast, DriverExpect, KernelExpect, ResumeReads, ScreenExpect, text, ucs2

ABORTED_SAME = harness.Outcome("AbortedSame", "EFI_ABORTED", "same")
REPORT = "platform: loader returned 0x8000000000000015 (EFI_ABORTED)\nplatform: memory same\n"


class PlatformReport(unittest.TestCase):
    # Only rows that must find a problem, beside one that must not: a check
    # that finds too much fails loudly in the scenarios anyway.
    def test_log_rows(self):
        rows = [
            ("in order", ("one", "three"), (), 0),
            ("out of order", ("three", "one"), (), 1),
            ("repeated text needs two occurrences", ("one", "one"), (), 1),
            ("forbidden present", (), ("two",), 1),
        ]
        for name, expect, forbid, count in rows:
            with self.subTest(name):
                self.assertEqual(len(harness.check_log("one\ntwo\nthree\n", expect, forbid)), count)

    def test_report_rows(self):
        changed = harness.Outcome("AbortedChanged", "EFI_ABORTED", "changed")
        missing = harness.Outcome("LoaderMissing")
        rows = [
            ("as wanted", REPORT, ABORTED_SAME, "EFI_ABORTED", None, 0),
            ("exit code says memory changed", REPORT, changed, "EFI_ABORTED", None, 1),
            ("log says memory changed", REPORT.replace("same", "changed (before 9 pages, after 8 pages)"),
             ABORTED_SAME, "EFI_ABORTED", None, 1),
            ("wrong status", REPORT, ABORTED_SAME, "EFI_SUCCESS", None, 2),
            ("no report", "", ABORTED_SAME, "EFI_ABORTED", None, 2),
            ("two reports", REPORT + REPORT, ABORTED_SAME, "EFI_ABORTED", None, 2),
            ("platform failure not wanted", "", missing, "EFI_ABORTED", None, 3),
            ("timeout", "", harness.Outcome("Timeout"), "EFI_ABORTED", "LoaderMissing", 1),
        ]  # fmt: skip
        for name, log, outcome, status, exit_name, count in rows:
            with self.subTest(name):
                problems = harness.check_report(log, outcome, status, "same", exit_name)
                self.assertEqual(len(problems), count, problems)


# A boot's report as the kernel prints it, cut short: the loader's last
# messages, then the kernel's lines.
KERNEL_LOG = """\
root device uuid is '0FAB1E5D-3C2B-4A19-8E7F-60C5D4B3A291'
kernel: start
kernel: bootargs commandLine="foo=1 q=\\"a b\\" \\\\ \\x01"
kernel: bootargs videoDisplayMode=1
kernel: bootargs runtimePageCount=0x788
kernel: tree / (0 properties, 2 children)
kernel: tree   chosen/ (2 properties, 1 child)
kernel: tree     boot-uuid = "0FAB1E5D-3C2B-4A19-8E7F-60C5D4B3A291"
kernel: tree     boot-file = "nimb_kernel"
kernel: tree     memory-map/ (1 property, 0 children)
kernel: tree       BootCLUT = <00 b0 10 00 00 03 00 00> (address 0x10b000, length 0x300)
kernel: tree   efi/ (0 properties, 1 child)
kernel: tree     platform/ (1 property, 0 children)
kernel: tree       Model = u"QEMU1,1"
kernel: check tree-walk ok 5 nodes, 5 properties, 0x200 of 0x200 bytes
kernel: range BootCLUT address=0x10b000 length=0x300
kernel: driver "com.x.A" from=loader address=0x120000 plist=0x6 code=0x3 sum=0x24d0127
kernel: driver "com.x.B" from=loader address=0x121000 plist=0x1 code=0x0 sum=0x1
kernel: package address=0x122000 length=0x3 sum=0x24d0127
kernel: drivers from=loader blocks=2 package=1
kernel: result pass (1 checks, 0 failed)
"""


class KernelReport(unittest.TestCase):
    def test_parse(self):
        # What the check rows below don't show on their own: escapes undone,
        # numbers read, every line of a known kind.
        report = harness.parse_kernel_report(KERNEL_LOG)
        self.assertEqual(report.bootargs["commandLine"], 'foo=1 q="a b" \\ \x01')
        self.assertEqual(report.bootargs["runtimePageCount"], 0x788)
        self.assertEqual(report.tree["/chosen/memory-map"]["BootCLUT"],
                         "<00 b0 10 00 00 03 00 00> (address 0x10b000, length 0x300)")  # fmt: skip
        self.assertEqual(report.drivers, [("com.x.A", "loader", 6, 3, 0x24D0127), ("com.x.B", "loader", 1, 0, 1)])
        self.assertEqual((report.package, report.drivers_from, report.unknown), ((3, 0x24D0127), "loader", []))

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
            "(1 checks, 0 failed)", "(1 checks, 1 failed)"
        ).replace("result pass", "result fail")
        rows = [
            ("as wanted", KERNEL_LOG, good, []),
            ("no kernel", "Loading 'nimb_kernel'...\n", good, ["no report"]),
            ("started twice", "kernel: start\n" + KERNEL_LOG, good, ["started 2 times"]),
            ("broke off", KERNEL_LOG.split("kernel: result")[0], good, ["no result line"]),
            ("a check failed", failing_check, good, ["check tree-walk FAIL"]),
            ("a failure wanted, none came", KERNEL_LOG, KernelExpect(result="fail"), ["every check passed"]),
            ("result disagrees with the checks", KERNEL_LOG.replace("(1 checks", "(2 checks"), good,
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



GREY = (191, 191, 191)


def screen(picture=None, at=None, extra=(), width=1280, height=800):
    """An Image of the grey screen with the 128 x 128 `picture` (list of
    pixels) at `at` (default: centred) and single `extra` pixels ((x, y, rgb))."""
    rows = [bytearray(bytes(GREY) * width) for _ in range(height)]
    x0, y0 = at or ((width - 128) >> 1, (height - 128) >> 1)
    for i, rgb in enumerate(picture or ()):
        rows[y0 + i // 128][3 * (x0 + i % 128) : 3 * (x0 + i % 128) + 3] = bytes(rgb)
    for x, y, rgb in extra:
        rows[y][3 * x : 3 * x + 3] = bytes(rgb)
    return harness.Image(width, height, [bytes(row) for row in rows])


class Screen(unittest.TestCase):
    def test_check_rows(self):
        artwork = harness.read_artwork()
        logo, failure = artwork["logo"], artwork["failure"]
        self.assertEqual((len(logo), logo[0]), (128 * 128, GREY), "the logo's corner is the background")
        expect = ScreenExpect("x", picture="logo")
        rows = [
            ("logo in place", screen(logo), expect, 0, 0),
            ("one pixel right", screen(logo, at=(577, 336)), expect, 1, 0),
            ("two pixels right, out of centre", screen(logo, at=(578, 336)), expect, 1, 1),
            ("red and blue swapped", screen([(b, g, r) for r, g, b in logo]), expect, 1, 0),
            ("the other picture", screen(failure), expect, 1, 0),
            ("nothing drawn", screen(), expect, 1, 0),
            ("text beside the logo", screen(logo, extra=[(240, 219, (0, 0, 0))]), expect, 0, 2),
            ("a dot below the logo", screen(logo, extra=[(640, 470, (0, 0, 0))]), expect, 0, 1),
            ("any picture, none there", screen(), ScreenExpect("x"), 1, 0),
            ("background not grey", harness.Image(4, 4, [bytes(12)] * 4), expect, 1, 0),
        ]
        for name, image, wanted, picture_count, stray_count in rows:
            with self.subTest(name):
                picture, stray = harness.check_screen(image, wanted, artwork)
                self.assertEqual((len(picture), len(stray)), (picture_count, stray_count), (picture, stray))


    def test_text_rows(self):
        line = "Press a key to go on."

        def console(text, x=3, y=5):
            """A black screen with `text` drawn in cells, a made-up picture a character."""
            rows = [bytearray(3 * 400) for _ in range(60)]
            for i, char in enumerate(text):
                bits = random.Random(char).getrandbits(8 * 19) if char != " " else 0
                for dy in range(19):
                    for dx in range(8):
                        value = 200 * (bits >> (8 * dy + dx) & 1)
                        rows[y + dy][3 * (x + 8 * i + dx) : 3 * (x + 8 * i + dx + 1)] = bytes([value] * 3)
            return harness.Image(400, 60, [bytes(row) for row in rows])

        rows = [
            ("the line", console(line), line, True),
            ("a character other", console(line), "Press a key to go in.", False),
            ("cut short", console(line), line[:-1], False),
            ("a blank screen", console(""), line, False),
            ("at the screen's edge", console(line, x=0, y=41), line, True),
        ]
        for name, image, text, wanted in rows:
            with self.subTest(name):
                self.assertEqual(harness.find_text(image, text) is not None, wanted)


class Resume(unittest.TestCase):
    def test_reads_rows(self):
        header = "platform: read partition=2 offset=0x10000 size=0x200 to=0x1de86d18 status=0x0\n"
        inside = "platform: read partition=2 offset=0x10200 size=0xfe00 to=0x5000200 status=0x0\n"
        beyond = "platform: read partition=2 offset=0x20000 size=0x100000 to=0x5010000 status=0x0\n"
        unaligned = "platform: read partition=2 offset=0x10200 size=0x100 to=0x5000300 status=0x0\n"
        volume = "platform: read partition=1 offset=0x108400 size=0x10000 to=0x1de12418 status=0x0\n"
        rows = [
            (volume + header, ResumeReads(), []),
            (header + inside, ResumeReads(), ["1 reads after the header"]),
            (header + inside + beyond, ResumeReads(after_header=None), ["leave the first stage"]),
            (header + unaligned, ResumeReads(after_header=None), ["no page + 512"]),
            (inside, ResumeReads(), ["not the 512-byte header"]),
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
            (firmware + trace.format("1fe9fb00", "elsewhere"), 1),
            (trace.format("1eb20072", "elsewhere"), 1),
        ]
        for log, count in rows:
            self.assertEqual(len(harness.check_key_trace(log)), count, log)


if __name__ == "__main__":
    unittest.main()
