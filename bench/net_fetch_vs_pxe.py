#!/usr/bin/env python3
"""Figure net-fetch-vs-pxe: the loader's fetch of a 16 MiB kernel over the
platform layer's network file loader against the firmware's own PXE download
of a boot file of the same size, in the same QEMU run.

The served directory holds the platform layer padded to 16 MiB (the boot
file that the firmware's PXE fetches), the loader, the reference kernel
padded to 16 MiB and its driver package. With net.time-pxe=1 the platform
has the firmware's PXE download its boot file once more before it starts the
loader, then fetches the same file over its own network LoadFile (the
transfer alone, without the loader around it); all transfers are timed with the TSC on either side of the
transfer alone, and the log carries the counter values. QEMU runs with
-icount, so that virtual time (and the TSC) follows the instructions the
guest runs rather than the host's clock: the ratio means something, the
ticks alone don't.

    bench/net_fetch_vs_pxe.py [--runs N] [--efi-dir build/efi] [--guest-dir build/tests/guest]

Prints each run's times and the figure of the median run:
    figure net-fetch-vs-pxe: LOADER Mticks vs FIRMWARE Mticks = R.RRx
where R is the loader's time over the firmware's (goal: at most 1.2x).
"""

import argparse
import re
import shutil
import statistics
import sys
import tempfile
from pathlib import Path

REPO = Path(__file__).resolve().parents[1]
sys.path.insert(0, str(REPO / "tests" / "qemu"))
import harness  # noqa: E402

SIZE = 16 << 20
# Virtual time by instructions, not by the host's clock: the TSC then counts
# the guest's own work, whatever else the host is busy with. Without it the
# ratio wanders with the host's load.
ICOUNT = ("-icount", "shift=2,align=off,sleep=off")
KERNEL = "nimb.tarnix"
TSC = re.compile(r"platform: tsc ([\w-]+)=0x([0-9a-f]+)")
READ = re.compile(r"platform: net read of (\S+) into (\d+) bytes: (\w+), (\d+) bytes")
PXE = re.compile(r"platform: net firmware download of the boot file: (\w+), (\d+) bytes")


def padded(path, size):
    data = Path(path).read_bytes()
    return data + bytes(max(0, size - len(data)))


def serve(directory, efi_dir, guest_dir):
    directory.mkdir()
    (directory / harness.NET_BOOT_FILE).write_bytes(padded(Path(efi_dir) / "BOOTX64.efi", SIZE))
    shutil.copyfile(Path(efi_dir) / "nimbboot.efi", directory / "nimbboot.efi")
    (directory / KERNEL).write_bytes(padded(Path(guest_dir) / "nimb_kernel", SIZE))
    (directory / f"{KERNEL}.drvpk").write_bytes(bytes(4096))
    (directory / "platform.cfg").write_text("net.time-pxe=1\n")


def measure(log):
    """Ticks of one run's log: the firmware's download of the boot file, the
    platform's own fetch of the same file over the network's LoadFile, and
    the loader's fetch of the kernel."""
    ticks, reading = {}, None
    for line in log.splitlines():
        pxe, read, tsc = PXE.search(line), READ.search(line), TSC.search(line)
        if pxe and (pxe.group(1) != "EFI_SUCCESS" or int(pxe.group(2)) != SIZE):
            raise RuntimeError(f"the firmware's download: {line.strip()}")
        if read and read.group(1) in (KERNEL, harness.NET_BOOT_FILE):
            if read.group(3) != "EFI_SUCCESS" or int(read.group(4)) != SIZE:
                raise RuntimeError(f"a fetch: {line.strip()}")
        if "net read of" in line and line.rstrip().endswith("starts"):
            reading = line.split("net read of ")[1].split()[0]
        if tsc:
            moment, value = tsc.group(1), int(tsc.group(2), 16)
            if moment.startswith("pxe-download"):
                ticks[moment] = value
            elif moment.startswith("net-read") and reading in (KERNEL, harness.NET_BOOT_FILE):
                ticks[f"{reading}:{moment}"] = value
    spans = {
        "firmware": ("pxe-download-start", "pxe-download-end"),
        "platform": (f"{harness.NET_BOOT_FILE}:net-read-start", f"{harness.NET_BOOT_FILE}:net-read-end"),
        "loader": (f"{KERNEL}:net-read-start", f"{KERNEL}:net-read-end"),
    }
    missing = [moment for pair in spans.values() for moment in pair if moment not in ticks]
    if missing:
        raise RuntimeError(f"moments missing from the log: {missing}")
    return {name: ticks[end] - ticks[start] for name, (start, end) in spans.items()}


def main():
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--runs", type=int, default=1)
    parser.add_argument("--efi-dir", default=str(REPO / "build" / "efi"))
    parser.add_argument("--guest-dir", default=str(REPO / "build" / "tests" / "guest"))
    parser.add_argument("--timeout", type=float, default=600.0)
    parser.add_argument("--keep", action="store_true", help="keep each run's files (log, packets)")
    args = parser.parse_args()
    results = []
    for run in range(args.runs):
        workdir = Path(tempfile.mkdtemp(prefix="nimb-bench-net-"))
        served = workdir / "tftp"
        serve(served, args.efi_dir, args.guest_dir)
        returncode, log, _ = harness.boot(served, workdir, args.timeout, network=True, extra=ICOUNT)
        try:
            times = measure(log)
        except RuntimeError as error:
            print(f"run {run + 1}: {error}; files kept in {workdir}", file=sys.stderr)
            return 1
        if not args.keep:
            shutil.rmtree(workdir, ignore_errors=True)
        firmware, platform, loader = times["firmware"], times["platform"], times["loader"]
        print(f"run {run + 1}: firmware {firmware / 1e6:.1f} Mticks, the platform's own fetch of the same file "
              f"{platform / 1e6:.1f} Mticks ({platform / firmware:.2f}x), loader {loader / 1e6:.1f} Mticks "
              f"({loader / firmware:.2f}x)")
        results.append((loader / firmware, firmware, loader))
    ratio = statistics.median(result[0] for result in results)
    _, firmware, loader = min(results, key=lambda result: abs(result[0] - ratio))
    print(f"figure net-fetch-vs-pxe: {loader / 1e6:.1f} Mticks vs {firmware / 1e6:.1f} Mticks = {ratio:.2f}x")
    return 0


if __name__ == "__main__":
    sys.exit(main())
