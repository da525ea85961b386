#!/usr/bin/env python3
"""Boots the EFI programs under QEMU and OVMF and checks what they print.

Each scenario (scenarios.py) describes an EFI system partition: the platform
layer at \\EFI\\BOOT\\BOOTX64.EFI, the loader at \\EFI\\BOOT\\nimbboot.efi, the
platform's configuration file and any other files and directories. The
harness builds a GPT disk image with that partition (no mounting: sgdisk and
mtools), boots it headless under TCG, and reads the serial log and the exit
code that the platform layer leaves through the debug-exit device.

    harness.py --efi-dir build/efi --scenario no_kernel    one scenario
    harness.py --efi-dir build/efi                          all scenarios
    harness.py --list                                        names only
    harness.py --demo                                        boot, screenshot into out/
"""

import argparse
import dataclasses
import json
import os
import re
import shutil
import signal
import socket
import subprocess
import sys
import tempfile
import time
from pathlib import Path

sys.path.insert(0, str(Path(__file__).resolve().parent))
from scenarios import BASE_CONFIG, SCENARIOS  # noqa: E402

REPO = Path(__file__).resolve().parents[2]
EXIT_CODES_HEADER = REPO / "platform" / "exitcodes.h"
DEMO_SCREEN = REPO / "out" / "demo-screen.png"

OVMF_DIRS = ("/usr/share/OVMF", "/usr/share/ovmf", "/usr/share/qemu")
DISK_BYTES = 64 << 20
PARTITION_OFFSET = 1 << 20  # first sector 2048

# The platform's report, on the serial port.
REPORT_STATUS = re.compile(r"platform: loader returned 0x([0-9a-f]+) \((\w+)\)")
REPORT_MEMORY = re.compile(r"platform: memory (same|changed)")
REPORT_CONSOLE_MODE = re.compile(r"platform: console mode (\S+)")


# --- the platform's exit codes -------------------------------------------------------


@dataclasses.dataclass(frozen=True)
class Outcome:
    """What a run's exit status says."""

    name: str  # the platform's name for the code, or a word of the harness's own
    status: str | None = None  # the loader's status, when the loader came back
    memory: str | None = None  # "same" or "changed", when the loader came back


STATUS_OF_PREFIX = {"Aborted": "EFI_ABORTED", "Success": "EFI_SUCCESS", "Other": "other"}


def read_exit_codes(header=EXIT_CODES_HEADER):
    """The table of platform/exitcodes.h: code -> Outcome."""
    codes = {}
    pattern = re.compile(r"constexpr\s+UINT8\s+kExit(\w+)\s*=\s*(0x[0-9A-Fa-f]+|\d+)\s*;")
    for match in pattern.finditer(Path(header).read_text()):
        name, code = match.group(1), int(match.group(2), 0)
        outcome = Outcome(name)
        loader = re.fullmatch(r"(Aborted|Success|Other)(Same|Changed)", name)
        if loader:
            outcome = Outcome(name, STATUS_OF_PREFIX[loader.group(1)], loader.group(2).lower())
        if code in codes:
            raise ValueError(f"{header}: code {code:#x} given twice")
        codes[code] = outcome
    if not codes:
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


# --- the serial log ----------------------------------------------------------------

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


# --- the disk ------------------------------------------------------------------------


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


def run_tool(*args, env=None):
    subprocess.run(args, check=True, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, env=env)


def build_disk(image, files, directories=()):
    """A GPT disk of DISK_BYTES with one EFI system partition holding `files`
    (ESP path with '/' -> bytes or host Path) and `directories` (ESP paths)."""
    image = Path(image).resolve()
    with open(image, "wb") as disk:
        disk.truncate(DISK_BYTES)
    # A fresh image has nothing to zap, and each of sgdisk's steps costs a
    # second of waiting for the kernel to reread the table.
    run_tool("sgdisk", "-o", "-n", "1:2048:0", "-t", "1:EF00", str(image))
    volume = f"{image}@@{PARTITION_OFFSET}"
    env = dict(os.environ, MTOOLS_SKIP_CHECK="1")
    run_tool("mformat", "-i", volume, "-F", "-v", "ESP", "::", env=env)
    needed = set()
    for path in list(directories) + [str(Path(p).parent) for p in files]:
        parts = Path(path.strip("/")).parts
        needed.update("/".join(parts[: i + 1]) for i in range(len(parts)))
    needed.discard("")
    for directory in sorted(needed, key=lambda d: (d.count("/"), d)):
        run_tool("mmd", "-i", volume, f"::/{directory}", env=env)
    staging = image.parent / "files"
    for path, content in files.items():
        source = content
        if not isinstance(content, Path):
            source = staging / path.strip("/")
            source.parent.mkdir(parents=True, exist_ok=True)
            source.write_bytes(content.encode() if isinstance(content, str) else content)
        run_tool("mcopy", "-i", volume, str(Path(source).resolve()), f"::/{path.strip('/')}", env=env)


# --- QEMU ----------------------------------------------------------------------------


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


def qemu_command(workdir, disk, serial_log, qmp_socket=None):
    code, variables = find_ovmf()
    private_vars = workdir / "OVMF_VARS.fd"
    shutil.copyfile(variables, private_vars)
    command = [
        "qemu-system-x86_64", "-machine", "q35", "-m", "512M", "-accel", "tcg",
        "-display", "none", "-no-reboot",
        "-drive", f"if=pflash,format=raw,unit=0,readonly=on,file={code}",
        "-drive", f"if=pflash,format=raw,unit=1,file={private_vars}",
        "-drive", f"format=raw,file={disk}",
        "-device", "isa-debug-exit,iobase=0xf4,iosize=0x04",
        "-nic", "none", "-serial", f"file:{serial_log}", "-monitor", "none",
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


# --- scenarios ------------------------------------------------------------------------


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


def prepare(scenario, efi_dir, workdir, loader=None, config_override=None):
    """Builds the scenario's disk in `workdir`; returns its path."""
    efi_dir = Path(efi_dir)
    files = {
        "EFI/BOOT/BOOTX64.EFI": efi_dir / "BOOTX64.efi",
        "EFI/BOOT/nimbboot.efi": Path(loader) if loader else efi_dir / "nimbboot.efi",
    }
    for path in files.values():
        if not path.is_file():
            raise FileNotFoundError(f"{path} is missing: build the EFI programs first")
    config = scenario_config(scenario, config_override)
    if config or scenario.config_file:
        files["EFI/BOOT/platform.cfg"] = render_config(config)
    files.update(scenario.files)
    for path in scenario.remove:
        files.pop(path, None)
    disk = workdir / "disk.img"
    build_disk(disk, files, scenario.directories)
    return disk


def run_scenario(scenario, efi_dir, loader=None, timeout=None):
    start = time.monotonic()
    workdir = Path(tempfile.mkdtemp(prefix=f"nimb-qemu-{scenario.name}-"))
    try:
        disk = prepare(scenario, efi_dir, workdir, loader)
    except BaseException:
        shutil.rmtree(workdir, ignore_errors=True)
        raise
    serial_log = workdir / "serial.log"
    machine = Machine(qemu_command(workdir, disk, serial_log), workdir / "qemu.log")
    returncode = machine.wait(timeout or scenario.timeout)
    log = clean_log(serial_log.read_bytes()) if serial_log.exists() else ""
    (workdir / "serial.txt").write_text(log)
    outcome = decode_exit(returncode, read_exit_codes())
    problems = check_report(log, outcome, scenario.status, scenario.memory, scenario.exit)
    problems += check_log(log, scenario.expect, scenario.forbid)
    problems += check_console_modes(log, scenario.console_modes)
    if returncode is None:
        problems.insert(0, f"timed out after {timeout or scenario.timeout} s")
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
    print(f"--- files kept in {result.workdir} ---")


# --- demo ------------------------------------------------------------------------------


class Qmp:
    """A QMP connection: commands as JSON lines, answers read past events."""

    def __init__(self, path, deadline):
        while True:
            try:
                self.sock = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
                self.sock.connect(str(path))
                break
            except (FileNotFoundError, ConnectionRefusedError):
                self.sock.close()
                if time.monotonic() > deadline:
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


def demo(efi_dir, loader=None, timeout=120.0):
    """Boots the no-kernel volume in graphics mode, prints the serial log as it
    comes, takes a screenshot when the platform reports, then quits."""
    scenario = SCENARIOS["no_kernel"]
    workdir = Path(tempfile.mkdtemp(prefix="nimb-qemu-demo-"))
    disk = prepare(scenario, efi_dir, workdir, loader, {"hold": 3, "console": "graphics"})
    serial_log, qmp_socket = workdir / "serial.log", workdir / "qmp.sock"
    DEMO_SCREEN.parent.mkdir(parents=True, exist_ok=True)
    if DEMO_SCREEN.exists():
        DEMO_SCREEN.unlink()
    machine = Machine(qemu_command(workdir, disk, serial_log, qmp_socket), workdir / "qemu.log")
    deadline = time.monotonic() + timeout
    printed, pending, shot = 0, "", False
    try:
        qmp = Qmp(qmp_socket, deadline)
        while machine.poll() is None and time.monotonic() < deadline:
            raw = serial_log.read_bytes() if serial_log.exists() else b""
            pending += raw[printed:].decode("utf-8", errors="replace")
            printed = len(raw)
            *lines, pending = pending.split("\n")
            for line in lines:
                text = clean_log(line)
                if text.strip():
                    print(text, flush=True)
                if not shot and REPORT_MEMORY.search(text):
                    qmp.execute("screendump", filename=str(DEMO_SCREEN), format="png")
                    shot = True
                    qmp.execute("quit")
            time.sleep(0.1)
        qmp.close()
    finally:
        returncode = machine.wait(max(1.0, deadline - time.monotonic()))
    if not shot:
        print(f"demo: no report from the platform (exit {returncode}); files kept in {workdir}")
        return False
    shutil.rmtree(workdir, ignore_errors=True)
    print(f"demo: screenshot in {DEMO_SCREEN}")
    return True


# --- command line -----------------------------------------------------------------------


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--efi-dir", default=str(REPO / "build" / "efi"), help="where BOOTX64.efi and nimbboot.efi are")
    parser.add_argument("--loader", help="another EFI program to start in place of nimbboot.efi")
    parser.add_argument("--scenario", action="append", help="run this scenario (repeatable; default all)")
    parser.add_argument("--timeout", type=float, help="seconds per run, instead of the scenario's own")
    parser.add_argument("--show-log", action="store_true", help="print the serial log of passing runs too")
    parser.add_argument("--list", action="store_true", help="print the scenarios' names")
    parser.add_argument("--demo", action="store_true", help="boot in graphics mode and take a screenshot")
    args = parser.parse_args(argv)
    for number in (signal.SIGTERM, signal.SIGINT, signal.SIGHUP):
        signal.signal(number, Machine.kill_all)

    if args.list:
        print("\n".join(SCENARIOS))
        return 0
    if args.demo:
        return 0 if demo(args.efi_dir, args.loader) else 1
    names = args.scenario or list(SCENARIOS)
    unknown = [name for name in names if name not in SCENARIOS]
    if unknown:
        parser.error(f"unknown scenario(s): {', '.join(unknown)}")
    failed = 0
    for name in names:
        try:
            result = run_scenario(SCENARIOS[name], args.efi_dir, args.loader, args.timeout)
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
