#!/usr/bin/env python3
"""Figure cache-boot-vs-read: the loader's time from its start to the kernel's
entry when it boots from a kernel cache of about 16 MiB, against the
firmware's own time to read the same file, in one QEMU run.

The cache holds the reference kernel with a large driver prelinked: 4 MiB of
real x86 code (the host's own shared libraries and programs), which
compresses as a kernel does, then incompressible bytes up to a cache of about
16 MiB (the cache writer's optimal parse takes minutes on tens of MiB of
code, and the kernel's segments must fit the firmware's free low memory).
The kernel is the one linked at 64 MiB, since the firmware leaves no room
for 16 MiB behind 1 MiB. The platform layer reads the cache whole through the
firmware's file system (time-read in platform.cfg) and notes the time stamp
counter around that read and right before it starts the loader; the kernel
notes it at its entry. Under TCG the counter follows virtual time, so only
the ratio means anything.

    bench/cache_boot.py [--efi-dir build/efi] [--guest-dir build/tests/guest] [--tools-dir build/tools]
                        [--icount] [--breakdown]

With --icount, QEMU counts virtual time by the guest's instructions
(-icount shift=2): the loader's work then weighs what it executes, whatever
the host's load, and the firmware's read weighs the instructions the firmware
runs while the device's transfer (a host memory copy) takes no virtual time.

Prints the counts and `figure cache-boot-vs-read: L Mcycles vs F Mcycles = R.RRx`
(loader's time over the read's; the goal is at most 1.25x). Exit status 1
when the boot did not reach the kernel from its cache.
"""

import argparse
import random
import re
import shutil
import sys
import tempfile
from pathlib import Path

REPO = Path(__file__).resolve().parents[1]
sys.path.insert(0, str(REPO / "tests" / "qemu"))
import harness  # noqa: E402
from scenarios import EXTENSIONS_DIR, KernelCache, Scenario, driver_plist, kernel_file, mkdisk  # noqa: E402

CACHE_BYTES = 16 << 20
# Virtual time by instructions, as bench/net_fetch_vs_pxe.py runs QEMU.
ICOUNT = ("-icount", "shift=2,align=off,sleep=off")
# Places to take real x86-64 code from, in this order.
CODE_SOURCES = ("/usr/lib/x86_64-linux-gnu", "/usr/bin", "/usr/lib")
PAYLOAD = f"{EXTENSIONS_DIR}/Payload.drvb"
CODE_BYTES = 4 << 20
# What the cache writer makes of a byte: real code shrinks to about 0.42,
# random bytes grow by a flag bit each.
CODE_SHARE, RANDOM_SHARE = 0.42, 1.13


def real_code(size):
    """`size` bytes of the host's executables and libraries, whole files in
    name order."""
    out = bytearray()
    for directory in CODE_SOURCES:
        for path in sorted(Path(directory).glob("*")):
            if len(out) >= size:
                return bytes(out[:size])
            try:
                if path.is_file() and not path.is_symlink() and path.read_bytes()[:4] == b"\x7fELF":
                    out += path.read_bytes()
            except OSError:
                continue
    if len(out) < size:
        raise SystemExit(f"cache_boot: found only {len(out)} bytes of executables")
    return bytes(out)


def text_moments(log):
    """(moment, text) of each `platform: tsc text=` line and the text the
    loader wrote behind it (the loader writes a character at a time)."""
    found = re.findall(r"platform: tsc text=0x([0-9a-f]+)\n(.*?)(?=\nplatform: |\Z)", log, re.S)
    return [(int(value, 16), text) for value, text in found]


def breakdown(log, entry):
    """Where the loader's time went, from the moments of its texts: up to
    the cache's look-up, the read (from the line after the look-up to the
    last of the dots that follow, one a read chunk), the rest
    (decompression, checksum, placing, hand-off) up to the kernel's entry.
    None when the texts are not there."""
    texts = text_moments(log)
    written = "".join(text for _, text in texts)
    look_at = written.find("Looking for kernel cache")
    if look_at < 0:
        return None
    starts, offset = [], 0
    for moment, text in texts:
        starts.append((offset, moment))
        offset += len(text)
    look = next(moment for at, moment in starts if at + 1 > look_at)
    after = written.index("\n", look_at) + 1
    # The run of dots right behind the look-up's line.
    run_end = after + len(written[after:]) - len(written[after:].lstrip("."))
    dots = [moment for (at, moment), (_, text) in zip(starts, texts) if after <= at < run_end]
    if not dots:
        return None
    return look, dots[-1] - look, entry - dots[-1]


def tsc_moments(log):
    moments = {name: int(value, 16) for name, value in re.findall(r"platform: tsc (\S+)=0x([0-9a-f]+)", log)}
    entry = harness.parse_kernel_report(log).tsc.get("entry")
    if entry is not None:
        moments["kernel-entry"] = entry
    return moments


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--efi-dir", default=str(REPO / "build" / "efi"))
    parser.add_argument("--guest-dir", default=str(harness.GUEST_DIR))
    parser.add_argument("--tools-dir", default=str(harness.TOOLS_DIR))
    parser.add_argument("--code-mib", type=float, default=CODE_BYTES / (1 << 20), help="MiB of real code in the driver")
    parser.add_argument("--cache-mib", type=float, default=CACHE_BYTES / (1 << 20), help="the cache's size to aim at")
    parser.add_argument("--keep", action="store_true", help="keep the work directory")
    parser.add_argument("--icount", action="store_true",
                        help="run QEMU with -icount: the counter then follows the instructions the guest runs, "
                             "not the host's clock")
    parser.add_argument("--breakdown", action="store_true",
                        help="boot once more with time-text=1 and say where the loader's time went")
    args = parser.parse_args(argv)
    harness.TOOLS_DIR = Path(args.tools_dir)

    code = int(args.code_mib * (1 << 20))
    filler = max(0, int((args.cache_mib * (1 << 20) - code * CODE_SHARE) / RANDOM_SHARE))
    payload = real_code(code) + random.Random(1).randbytes(filler)
    scenario = Scenario(
        "cache_boot",
        # Linked at 64 MiB: the firmware leaves no 16 MiB free behind 1 MiB.
        files={
            **kernel_file("nimb_kernel.high"),
            f"{PAYLOAD}/Info.plist": driver_plist("com.quill.driver.Payload", "Root", "Payload"),
            f"{PAYLOAD}/Payload": payload,
        },
        cache=KernelCache(args=("--drivers", f"volume:{EXTENSIONS_DIR}")),
        disk_mib=128,
    )
    workdir = Path(tempfile.mkdtemp(prefix="nimb-bench-cache-"))
    volume = workdir / "volume"
    volume.mkdir()
    config = harness.scenario_config(scenario)
    harness.stage_volume(scenario, volume, config, args.guest_dir)
    name = harness.make_cache(scenario.cache, volume, scenario.disk_mib << 20)
    cache = volume / name.replace("\\", "/")
    # The firmware reads the same file, timed, before the loader starts.
    config["time-read"] = "\\" + name
    (volume / mkdisk.BOOT_DIR / mkdisk.CONFIG_NAME).write_text(harness.render_config(config))
    disk = workdir / "disk.img"
    mkdisk.build_disk(disk, volume, Path(args.efi_dir) / "BOOTX64.efi", Path(args.efi_dir) / "nimbboot.efi",
                      disk_bytes=scenario.disk_mib << 20)
    qemu_args = ICOUNT if args.icount else ()
    returncode, log, _ = harness.boot(disk, workdir, 600, extra=qemu_args)
    (workdir / "serial.txt").write_text(log)

    report = harness.parse_kernel_report(log)
    moments = tsc_moments(log)
    wanted = ("read-start", "read-end", "start-image", "kernel-entry")
    size = cache.stat().st_size
    print(f"cache_boot: cache {name}, {size / (1 << 20):.1f} MiB, from a driver of {code / (1 << 20):.1f} MiB of code "
          f"and {filler / (1 << 20):.1f} MiB of random bytes")
    if report.drivers_from != "cache" or any(moment not in moments for moment in wanted):
        print(f"cache_boot: the boot did not reach the kernel from its cache (drivers from {report.drivers_from}, "
              f"moments {sorted(moments)}); log in {workdir / 'serial.txt'}")
        return 1
    read = moments["read-end"] - moments["read-start"]
    loader = moments["kernel-entry"] - moments["start-image"]
    print(f"cache_boot: firmware read {read} cycles, loader start to kernel entry {loader} cycles")
    print(f"figure cache-boot-vs-read: {loader / 1e6:.1f} Mcycles vs {read / 1e6:.1f} Mcycles = {loader / read:.2f}x")
    if args.breakdown:
        # The moments of the texts cost time of their own: a second boot.
        config["time-text"] = "1"
        (volume / mkdisk.BOOT_DIR / mkdisk.CONFIG_NAME).write_text(harness.render_config(config))
        mkdisk.build_disk(disk, volume, Path(args.efi_dir) / "BOOTX64.efi", Path(args.efi_dir) / "nimbboot.efi",
                          disk_bytes=scenario.disk_mib << 20)
        _, log, _ = harness.boot(disk, workdir, 600, extra=qemu_args)
        (workdir / "serial-texts.txt").write_text(log)
        moments = tsc_moments(log)
        parts = breakdown(log, moments.get("kernel-entry", 0)) if "start-image" in moments else None
        if parts is None:
            print("cache_boot: no breakdown: the texts' moments are missing")
        else:
            look, read_part, rest = parts
            print(f"cache_boot: breakdown (second boot, texts timed): to the cache's look-up "
                  f"{look - moments['start-image']} cycles, reading it {read_part}, decompressing, checking, "
                  f"placing and handing over {rest}; the firmware's read took {moments['read-end'] - moments['read-start']}")
    if args.keep:
        print(f"cache_boot: files in {workdir}")
    else:
        shutil.rmtree(workdir, ignore_errors=True)
    return 0


if __name__ == "__main__":
    sys.exit(main())
