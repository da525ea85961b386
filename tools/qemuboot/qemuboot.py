#!/usr/bin/env python3
"""qemuboot: boots the platform layer and the loader under QEMU and OVMF, from
a disk image (tools/mkdisk/mkdisk.py makes one of a directory) or over the
network from a directory that QEMU's TFTP server serves, and prints the
serial log as it comes.

    qemuboot.py disk.img                                  boot a disk
    qemuboot.py --net DIR                                 boot over the network
    qemuboot.py disk.img --screenshot shot.png --when "kernel: hold"
    qemuboot.py disk.img --log serial.txt --timeout 60 --quiet

With --net, DIR is staged into a served directory first: the platform layer
becomes the boot file BOOTX64.efi that the firmware's PXE starts, the loader
and DIR/EFI/BOOT/platform.cfg go to its root, and everything else (the
kernel and its driver package, by their paths on the server) stays as it is.
A screenshot is taken over QMP as soon as a serial line holds the text of
--when (PNG for a .png name, else PPM). The run ends when QEMU ends or at the
timeout. Exit status: QEMU's own (the debug-exit device of the platform layer
and of the reference kernel makes it (code << 1) | 1, see platform/exitcodes.h),
124 on a timeout, 2 for a wrong command line.

Needs qemu-system-x86_64 and OVMF (Debian packages qemu-system-x86, ovmf).
"""

import argparse
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

REPO = Path(__file__).resolve().parents[2]
OVMF_DIRS = ("/usr/share/OVMF", "/usr/share/ovmf", "/usr/share/qemu")
# The boot file that QEMU's DHCP server names on a network boot, at the root
# of the served directory.
NET_BOOT_FILE = "BOOTX64.efi"
LOADER_NAME = "nimbboot.efi"
NET_ID = "n0"
# The NIC's MAC address: not QEMU's default, so that a MAC that reaches the
# kernel came from the NIC.
NET_MAC = "52:54:00:a7:3c:e1"

# Escape sequences of the firmware's terminal emulation: CSI sequences,
# character set selections and two-character escapes.
ANSI_ESCAPE = re.compile(r"\x1b(?:\[[0-?]*[ -/]*[@-~]|[()][0-9A-Za-z]|[@-Z\\-_78=>c])")
CONTROL = re.compile(r"[\x00-\x08\x0b-\x1f\x7f]")


def clean_log(raw):
    """Serial output as plain text: escapes, carriage returns and other
    control characters removed."""
    text = raw.decode("utf-8", errors="replace") if isinstance(raw, bytes) else raw
    return CONTROL.sub("", ANSI_ESCAPE.sub("", text.replace("\r", "")))


def find_ovmf():
    """OVMF_CODE_4M.fd and OVMF_VARS_4M.fd, from the package's file list or the
    usual places."""
    candidates = []
    try:
        listing = subprocess.run(["dpkg", "-L", "ovmf"], capture_output=True, text=True, check=False).stdout
        candidates += [Path(line).parent for line in listing.splitlines() if line.endswith("OVMF_CODE_4M.fd")]
    except OSError:
        pass
    for directory in candidates + [Path(d) for d in OVMF_DIRS]:
        code, variables = directory / "OVMF_CODE_4M.fd", directory / "OVMF_VARS_4M.fd"
        if code.is_file() and variables.is_file():
            return code, variables
    raise FileNotFoundError("OVMF_CODE_4M.fd and OVMF_VARS_4M.fd not found (package ovmf)")


def serve_directory(volume, platform, loader, config_name="platform.cfg"):
    """Turns the staged volume `volume` into the directory served on a
    network boot, in place: the platform as the boot file, the loader (when
    given) as nimbboot.efi and the volume's EFI/BOOT/platform.cfg at its
    root."""
    volume = Path(volume)
    boot = volume / "EFI" / "BOOT"
    if (boot / config_name).is_file():
        (boot / config_name).rename(volume / config_name)
    for directory in (boot, boot.parent):
        if directory.is_dir() and not any(directory.iterdir()):
            directory.rmdir()
    shutil.copyfile(platform, volume / NET_BOOT_FILE)
    if loader is not None:
        shutil.copyfile(loader, volume / LOADER_NAME)
    return volume


def qemu_command(workdir, disk, serial_log, qmp_socket=None, tftp_dir=None, reboot=False, extra=(), bare=False,
                 usb=False, same_store=False):
    """QEMU's command line, on a private copy of the variable store in
    `workdir` (with `same_store`, the copy that an earlier machine there left,
    if any: the machine powers on with what it left in NVRAM). With `usb`,
    the disk is a USB stick on an xHCI controller. With
    `tftp_dir` and no `disk`, the machine boots over a virtio NIC without
    option ROM (so that the firmware's own PXE boots) from QEMU's TFTP server
    on that directory, every packet written to workdir/net.pcap; with
    `reboot`, a reset starts the machine again (on the same variable store)
    instead of ending QEMU; `extra` goes behind the accelerator; `bare` leaves
    out the serial port and the debug-exit device, as on a PC."""
    code, variables = find_ovmf()
    private_vars = Path(workdir) / "OVMF_VARS.fd"
    if not (same_store and private_vars.exists()):
        shutil.copyfile(variables, private_vars)
    drive = ["-drive", f"format=raw,file={disk}"]
    if usb:
        drive = ["-drive", f"if=none,id=stick,format=raw,file={disk}", "-device", "qemu-xhci",
                 "-device", "usb-storage,drive=stick,removable=on"]  # fmt: skip
    network = ["-nic", "none"]
    if tftp_dir is not None:
        network = [
            "-netdev", f"user,id={NET_ID},tftp={Path(tftp_dir).resolve()},bootfile={NET_BOOT_FILE}",
            "-device", f"virtio-net-pci,netdev={NET_ID},mac={NET_MAC},romfile=",
            "-object", f"filter-dump,id=dump0,netdev={NET_ID},file={Path(workdir) / 'net.pcap'}",
        ]  # fmt: skip
    return [
        "qemu-system-x86_64", "-machine", "q35", "-m", "512M", "-accel", "tcg", *extra,
        "-display", "none", *([] if reboot else ["-no-reboot"]),
        "-drive", f"if=pflash,format=raw,unit=0,readonly=on,file={code}",
        "-drive", f"if=pflash,format=raw,unit=1,file={private_vars}",
        *(drive if disk is not None else []),
        *([] if bare else ["-device", "isa-debug-exit,iobase=0xf4,iosize=0x04"]), *network,
        "-serial", "none" if bare else f"file:{serial_log}", "-monitor", "none",
        *(["-qmp", f"unix:{qmp_socket},server=on,wait=off"] if qmp_socket else []),
    ]  # fmt: skip


def _die_with_parent():
    """In the child before exec: QEMU gets SIGKILL when its parent dies."""
    try:
        import ctypes

        ctypes.CDLL(None, use_errno=True).prctl(1, signal.SIGKILL)  # PR_SET_PDEATHSIG
    except (OSError, AttributeError):
        pass


class Machine:
    """One QEMU process in a process group of its own, killed with its group
    when the time is up, on a signal (kill_all) or when its parent ends."""

    running = []

    def __init__(self, command, output_path):
        self._output = open(output_path, "wb")
        self.process = subprocess.Popen(
            command, stdin=subprocess.DEVNULL, stdout=self._output, stderr=subprocess.STDOUT,
            start_new_session=True, preexec_fn=_die_with_parent,
        )  # fmt: skip
        Machine.running.append(self)

    def wait(self, timeout):
        """The exit status, or None when the time ran out (QEMU is then gone)."""
        try:
            return self.process.wait(timeout=timeout)
        except subprocess.TimeoutExpired:
            self.kill()
            return None
        finally:
            if self in Machine.running:
                Machine.running.remove(self)
            self._output.close()

    def poll(self):
        return self.process.poll()

    def kill(self):
        try:
            os.killpg(self.process.pid, signal.SIGKILL)
        except ProcessLookupError:
            pass
        self.process.wait()

    @classmethod
    def kill_all(cls, *_):
        for machine in list(cls.running):
            machine.kill()
        sys.exit(130)


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


class Qmp:
    """A QMP connection: commands as JSON lines, answers read past events."""

    def __init__(self, path, deadline, machine):
        while True:
            self.sock = socket.socket(socket.AF_UNIX, socket.SOCK_STREAM)
            try:
                self.sock.connect(str(path))
                break
            except (FileNotFoundError, ConnectionRefusedError):
                self.sock.close()
                if time.monotonic() > deadline or machine.poll() is not None:
                    raise
                time.sleep(0.1)
        self.sock.settimeout(max(1.0, deadline - time.monotonic()))
        self.stream = self.sock.makefile("rwb")
        self._read()  # the greeting
        self.execute("qmp_capabilities")

    def _read(self):
        line = self.stream.readline()
        if not line:
            raise ConnectionError("QMP connection closed")
        return json.loads(line)

    def execute(self, command, **arguments):
        message = {"execute": command, **({"arguments": arguments} if arguments else {})}
        self.stream.write(json.dumps(message).encode() + b"\n")
        self.stream.flush()
        while True:
            answer = self._read()
            if "return" in answer:
                return answer["return"]
            if "error" in answer:
                raise RuntimeError(f"QMP {command}: {answer['error']}")

    def screendump(self, path):
        """The screen into `path`: PNG for a .png name, else PPM."""
        kind = {"format": "png"} if str(path).endswith(".png") else {}
        self.execute("screendump", filename=str(Path(path).resolve()), **kind)

    def close(self):
        self.stream.close()
        self.sock.close()


def boot(disk, workdir, timeout, on_line=None, network=False, reboot=False, qmp=False, echo=False, extra=(),
         bare=False, on_tick=None, tick=0.5, usb=False, same_store=False):
    """Runs QEMU on `disk` (with `network`: the directory served over TFTP)
    until it ends, for at most `timeout` seconds. `on_line(line, qmp)` hears
    each cleaned serial line as it comes, with a Qmp connection when `qmp` is
    set (else None), and stops the machine by returning True; with `echo`,
    each line is printed. `on_tick(qmp)`, when given, is called every `tick`
    seconds, the first time as soon as the machine runs (for a machine
    started paused with -S in `extra`, that call resumes it), and stops the
    machine in the same way (for a `bare` machine, which has no serial
    port); `usb` and `same_store` as for qemu_command. Returns QEMU's exit
    status (None: timed out or
    stopped), the cleaned serial log and what went wrong over QMP or in
    `on_line` (its OSError, ValueError, RuntimeError), or None."""
    workdir = Path(workdir)
    serial_log = workdir / "serial.log"
    serial_log.unlink(missing_ok=True)  # an earlier machine's, in the same workdir
    qmp_socket = workdir / "qmp.sock" if qmp else None
    command = qemu_command(workdir, None if network else disk, serial_log, qmp_socket, disk if network else None,
                           reboot, extra, bare, usb, same_store)
    machine = Machine(command, workdir / "qemu.log")
    deadline = time.monotonic() + timeout
    trouble, connection = None, None
    try:
        if on_line is not None or on_tick is not None or echo:
            connection = Qmp(qmp_socket, deadline, machine) if qmp else None
            follower, next_tick = SerialFollower(serial_log), 0.0
            while True:
                running = machine.poll() is None
                for line in follower.lines(final=not running):
                    if echo and line.strip():
                        print(line, flush=True)
                    if on_line is not None and on_line(line, connection) and running:
                        machine.kill()
                        running = False
                if on_tick is not None and running and time.monotonic() >= next_tick:
                    next_tick = time.monotonic() + tick
                    if on_tick(connection):
                        machine.kill()
                        running = False
                if not running or time.monotonic() > deadline:
                    break
                time.sleep(0.05)
    except (OSError, ValueError, RuntimeError) as error:
        trouble = f"{type(error).__name__}: {error}"
    finally:
        if connection is not None:
            connection.close()
        returncode = machine.wait(max(1.0, deadline - time.monotonic()))
    log = clean_log(serial_log.read_bytes()) if serial_log.exists() else ""
    return returncode, log, trouble


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("image", help="the disk image, or with --net the directory to stage and serve")
    parser.add_argument("--net", action="store_true", help="boot over the network from the directory IMAGE")
    parser.add_argument("--usb", action="store_true", help="attach the image as a USB stick (mkdisk --stick)")
    parser.add_argument("--efi-dir", default=str(REPO / "build" / "efi"), help="with --net: BOOTX64.efi, nimbboot.efi")
    parser.add_argument("--timeout", type=float, default=120.0, help="seconds before QEMU is stopped (120)")
    parser.add_argument("--screenshot", help="where the screenshot goes (.png or .ppm)")
    parser.add_argument("--when", default="", help="the serial text that the screenshot waits for (default: any)")
    parser.add_argument("--log", help="where the cleaned serial log goes, besides the terminal")
    parser.add_argument("--quiet", action="store_true", help="don't print the serial log as it comes")
    args = parser.parse_args(argv)
    for number in (signal.SIGTERM, signal.SIGINT, signal.SIGHUP):
        signal.signal(number, Machine.kill_all)
    with tempfile.TemporaryDirectory(prefix="qemuboot-") as workdir:
        image = Path(args.image)
        if args.net:
            efi = Path(args.efi_dir)
            image = serve_directory(shutil.copytree(image, Path(workdir) / "tftp"), efi / NET_BOOT_FILE,
                                    efi / LOADER_NAME)
        shots = []

        def on_line(line, qmp):
            if args.screenshot and not shots and args.when in line:
                qmp.screendump(args.screenshot)
                shots.append(args.screenshot)

        returncode, log, trouble = boot(image, workdir, args.timeout, on_line, network=args.net,
                                        qmp=bool(args.screenshot), echo=not args.quiet, usb=args.usb)
    if args.log:
        Path(args.log).write_text(log)
    for problem in [trouble] if trouble else []:
        print(f"qemuboot: {problem}", file=sys.stderr)
    if args.screenshot and not shots:
        print(f"qemuboot: no screenshot: no serial line held {args.when!r}", file=sys.stderr)
    if returncode is None:
        print(f"qemuboot: stopped after {args.timeout:g} s", file=sys.stderr)
        return 124
    return returncode


if __name__ == "__main__":
    sys.exit(main())
