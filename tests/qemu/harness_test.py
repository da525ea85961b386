"""Tests of the harness's own logic: log cleaning, expectation checks, exit
codes and the configuration file it writes. No QEMU needed."""

import tempfile
import unittest
from pathlib import Path

import harness
from scenarios import BASE_CONFIG, SCENARIOS, Scenario

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
            },
        )  # fmt: skip
        self.assertEqual(by_name["AbortedSame"][1], ABORTED_SAME)
        self.assertEqual(by_name["OtherChanged"][1].status, "other")
        self.assertIsNone(by_name["LoaderMissing"][1].status)
        self.assertTrue(all(code < 0x80 for code in codes))

    def test_decode_rows(self):
        codes = {0x10: ABORTED_SAME, 0x21: harness.Outcome("LoaderMissing")}
        rows = [
            ("debug exit", 0x21, "AbortedSame"),
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


if __name__ == "__main__":
    unittest.main()
