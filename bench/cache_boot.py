#!/usr/bin/env python3
"""Figure cache-boot-vs-read: the loader's time from its start to the kernel's
entry when it boots from a kernel cache of about 16 MiB, against the
firmware's own time to read the same file, in one QEMU run.

The cache holds the reference kernel with a large driver prelinked: real x86
code (the host's own shared libraries and programs), so that it compresses as
a kernel does. The platform layer reads the cache whole through the
firmware's file system (time-read in platform.cfg) and notes the time stamp
counter around that read and right before it starts the loader; the kernel
notes it at its entry. Under TCG the counter follows virtual time, so only
the ratio means anything.

    bench/cache_boot.py [--efi-dir build/efi] [--guest-dir build/tests/guest] [--tools-dir build/tools]

Prints the counts and `figure cache-boot-vs-read: L Mcycles vs F Mcycles = R.RRx`
(loader's time over the read's; the goal is at most 1.25x). Exit status 1
when the boot did not reach the kernel from its cache.
"""

import argparse
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
# Places to take real x86-64 code from, in this order.
CODE_SOURCES = ("/usr/lib/x86_64-linux-gnu", "/usr/bin", "/usr/lib")
PAYLOAD = f"{EXTENSIONS_DIR}/Payload.drvb"
# The payload is chosen so that its compressed form comes near 16 MiB; real
# code shrinks to about this share.
EXPECTED_RATIO = 0.55


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
    parser.add_argument("--payload-mib", type=float, help="the driver's size in MiB (default: for a 16 MiB cache)")
    parser.add_argument("--keep", action="store_true", help="keep the work directory")
    args = parser.parse_args(argv)
    harness.TOOLS_DIR = Path(args.tools_dir)

    payload = int(args.payload_mib * (1 << 20)) if args.payload_mib else int(CACHE_BYTES / EXPECTED_RATIO)
    scenario = Scenario(
        "cache_boot",
        files={
            **kernel_file(),
            f"{PAYLOAD}/Info.plist": driver_plist("com.quill.driver.Payload", "Root", "Payload"),
            f"{PAYLOAD}/Payload": real_code(payload),
        },
        cache=KernelCache(args=("--drivers", f"volume:{EXTENSIONS_DIR}")),
        disk_mib=128,
    )
    workdir = Path(tempfile.mkdtemp(prefix="nimb-bench-cache-"))
    volume = workdir / "volume"
    volume.mkdir()
    config = harness.scenario_config(scenario)
    harness.stage_volume(scenario, volume, config, args.guest_dir)
    name = harness.make_cache(scenario.cache, volume)
    cache = volume / name.replace("\\", "/")
    # The firmware reads the same file, timed, before the loader starts.
    config["time-read"] = "\\" + name
    (volume / mkdisk.BOOT_DIR / mkdisk.CONFIG_NAME).write_text(harness.render_config(config))
    disk = workdir / "disk.img"
    mkdisk.build_disk(disk, volume, Path(args.efi_dir) / "BOOTX64.efi", Path(args.efi_dir) / "nimbboot.efi",
                      disk_bytes=scenario.disk_mib << 20)
    returncode, log, _, _ = harness.boot(disk, workdir, 600)
    (workdir / "serial.txt").write_text(log)

    report = harness.parse_kernel_report(log)
    moments = tsc_moments(log)
    wanted = ("read-start", "read-end", "start-image", "kernel-entry")
    size = cache.stat().st_size
    print(f"cache_boot: cache {name}, {size / (1 << 20):.1f} MiB, from {payload / (1 << 20):.1f} MiB of driver code")
    if report.drivers_from != "cache" or any(moment not in moments for moment in wanted):
        print(f"cache_boot: the boot did not reach the kernel from its cache (drivers from {report.drivers_from}, "
              f"moments {sorted(moments)}); log in {workdir / 'serial.txt'}")
        return 1
    read = moments["read-end"] - moments["read-start"]
    loader = moments["kernel-entry"] - moments["start-image"]
    print(f"cache_boot: firmware read {read} cycles, loader start to kernel entry {loader} cycles")
    print(f"figure cache-boot-vs-read: {loader / 1e6:.1f} Mcycles vs {read / 1e6:.1f} Mcycles = {loader / read:.2f}x")
    if args.keep:
        print(f"cache_boot: files in {workdir}")
    else:
        shutil.rmtree(workdir, ignore_errors=True)
    return 0


if __name__ == "__main__":
    sys.exit(main())
