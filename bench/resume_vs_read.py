#!/usr/bin/env python3
"""resume-vs-read: the loader's resume of a 64 MiB encrypted first stage
against the firmware's own DiskIO read of the same extents, in one QEMU run.

The disk holds a resume image written by tools/mkresume (AES-256, the
restart probe of tests/guest/ as its restart code, no preview). Before it
starts the loader, the platform layer reads the image's extents through the
firmware's DiskIO and prints the time in TSC ticks; it then prints the TSC
just before StartImage, and the probe prints the TSC at its entry. The
loader's time is from StartImage to the probe's entry: the discovery, the
read, the decryption, ExitBootServices, the runtime map and the copy of the
restart code. QEMU runs with -cpu max (TCG), whose processor model has the
AES instructions. The TSC follows virtual time under TCG: only the ratio of
the two times in one run means anything.

The platform also prints the counter around each of the loader's DiskIO
reads, which splits the loader's time: up to its first read of the image
(discovery, the memory plan, the first drawing), the reads themselves, the
time between reads (the bar, the loop), from the last read to the
restart's GetMemoryMap (the decryption), and from there to the probe
(ExitBootServices, the runtime map, the copy of the restart code).

    bench/resume_vs_read.py [--efi-dir build/efi] [--guest-dir build/tests/guest] [--icount]

With --icount, QEMU counts virtual time by the guest's instructions (as
bench/cache_boot.py --icount does): the loader's work then weighs what it
executes, whatever each instruction costs the emulator (under TCG an AES
instruction is a call into a helper of QEMU's), and the host's load and
page cache no longer move the counter.

Prints `figure resume-vs-read: loader ... vs DiskIO read ... = R.RRx`, R
being the loader's time over the read's (the goal is at most 1.5x), and
exits 1 when the run gave no figure.
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
from cache_boot import ICOUNT  # noqa: E402
from scenarios import ResumeImage, Scenario  # noqa: E402

FIRST_STAGE = 64 << 20
TIMED_READ = re.compile(r"platform: timed read (\d+) bytes, (\d+) extents, (\d+) ticks \((\w+)\)")
# The platform's moment before StartImage and the probe's at its entry.
LOADER_START = re.compile(r"platform: tsc start-image=0x([0-9a-f]+)")
PROBE_ENTRY = re.compile(r"kernel: tsc entry=0x([0-9a-f]+)")
# The platform's moments around each of the loader's DiskIO reads.
READ_MOMENT = re.compile(r"platform: tsc read-(begin|end)=0x([0-9a-f]+)")
MEMORY_MAP = re.compile(r"platform: tsc memory-map=0x([0-9a-f]+)")

BENCH = Scenario(
    "resume_vs_read",
    resume=ResumeImage(
        args=("--key-bytes", "32", "--first-stage", str(FIRST_STAGE), "--extent-bytes", "1M",
              "--header-offset", "0x100000", "--area-start", "0x200000", "--timed-read"),  # fmt: skip
        partition_bytes=FIRST_STAGE + (8 << 20),
    ),
    timeout=1200.0,
)


def measure(efi_dir, guest_dir, keep, icount=False):
    workdir = Path(tempfile.mkdtemp(prefix="nimb-bench-resume-"))
    disk, _ = harness.prepare(BENCH, efi_dir, workdir, guest_dir=guest_dir)
    returncode, log, _ = harness.boot(disk, workdir, BENCH.timeout, extra=("-cpu", "max", *(ICOUNT if icount else ())))
    (workdir / "serial.txt").write_text(log)
    read, start, entry = TIMED_READ.search(log), LOADER_START.findall(log), PROBE_ENTRY.findall(log)
    report = harness.parse_kernel_report(log)
    problems = []
    if read is None or read.group(4) != "EFI_SUCCESS" or int(read.group(1)) != FIRST_STAGE:
        problems.append("no timed read of the whole first stage by the platform")
    if not start or not entry:
        problems.append("no TSC at StartImage or at the probe's entry")
    if report.result is None or not report.result[0]:
        failed = ", ".join(check.name for check in report.failed_checks())
        problems.append(f"the restart probe did not pass ({failed or 'no result'})")
    if problems:
        print(f"resume-vs-read: {'; '.join(problems)} (exit status {returncode}); files in {workdir}")
        return None
    if not keep:
        shutil.rmtree(workdir, ignore_errors=True)
    moments = [(kind, int(value, 16)) for kind, value in READ_MOMENT.findall(log)]
    reads = [(moments[i][1], moments[i + 1][1]) for i in range(0, len(moments) - 1, 2)
             if moments[i][0] == "begin" and moments[i + 1][0] == "end"]
    maps = [int(value, 16) for value in MEMORY_MAP.findall(log)]
    return int(start[-1], 16), int(entry[-1], 16), int(read.group(3)), int(read.group(2)), reads, maps


def breakdown(start, entry, reads, maps):
    """The loader's time in four parts, from its DiskIO reads' moments."""
    if not reads:
        return None
    header, image = reads[0], reads[1:]
    first = image[0][0] if image else header[1]
    last = image[-1][1] if image else header[1]
    reading = sum(end - begin for begin, end in image)
    # The restart's GetMemoryMap comes right after the decryption.
    restart = maps[-1] if maps and last <= maps[-1] <= entry else entry
    return [
        ("start to the first read of the image (discovery, plan, first drawing)", first - start),
        (f"the image's reads ({len(image)} DiskIO calls)", reading),
        ("between the reads (bar, loop)", last - first - reading),
        ("last read to the restart's GetMemoryMap (decryption, key wiped)", restart - last),
        ("GetMemoryMap to the probe (ExitBootServices, runtime map, restart code)", entry - restart),
    ]


def main(argv=None):
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--efi-dir", default=str(REPO / "build" / "efi"))
    parser.add_argument("--guest-dir", default=str(REPO / "build" / "tests" / "guest"))
    parser.add_argument("--keep", action="store_true", help="keep the run's files")
    parser.add_argument("--icount", action="store_true", help="QEMU's virtual time follows the guest's instructions")
    args = parser.parse_args(argv)
    measured = measure(args.efi_dir, args.guest_dir, args.keep, args.icount)
    if measured is None:
        return 1
    start, entry, read_ticks, extents, reads, maps = measured
    loader_ticks = entry - start
    parts = breakdown(start, entry, reads, maps)
    for name, ticks in parts or []:
        print(f"resume-vs-read: {name}: {ticks / 1e6:.1f} Mticks ({100 * ticks / loader_ticks:.0f}%)")
    mib = FIRST_STAGE / (1 << 20)
    print(f"resume-vs-read: {extents} extents; loader {loader_ticks} ticks, DiskIO read {read_ticks} ticks")
    print(
        f"figure resume-vs-read: loader {mib:.0f} MiB in {loader_ticks / 1e6:.1f} Mticks vs DiskIO read "
        f"{mib:.0f} MiB in {read_ticks / 1e6:.1f} Mticks = {loader_ticks / read_ticks:.2f}x"
    )
    return 0


if __name__ == "__main__":
    sys.exit(main())
