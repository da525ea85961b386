#!/usr/bin/env python3
"""mkdisk: turns a directory into a bootable GPT disk image for QEMU and OVMF.

The image has one EFI system partition (FAT32) that holds the directory's
files and directories as they stand, and in \\EFI\\BOOT the platform layer
(BOOTX64.EFI, which the firmware starts), the loader (nimbboot.efi), the
platform's configuration (platform.cfg) and the table of exact modification
times (platform.times). The firmware's FAT keeps times in 2-second steps;
the platform layer serves the times of the table instead, so that a kernel
cache or a driver package made exactly one second after its sources is
found as such, as on a file system that keeps seconds.

    mkdisk.py VOLUME -o disk.img                  the EFI programs of build/efi
    mkdisk.py VOLUME -o disk.img --set options=-v --set keys=shift
    mkdisk.py --boot-path                          the loader's boot device path, in hex
    mkdisk.py VOLUME -o stick.img --stick          an image for a USB stick (dd) and a real PC

Needs sgdisk (package gdisk) and mtools. Exit status 0 on success, 1 when the
image cannot be made, 2 for a wrong command line.
"""

import argparse
import datetime
import os
import re
import shutil
import struct
import subprocess
import sys
import tempfile
import uuid
from pathlib import Path

REPO = Path(__file__).resolve().parents[2]
DEFAULT_EFI_DIR = REPO / "build" / "efi"

DISK_BYTES = 64 << 20
SECTOR = 512
FIRST_SECTOR = 2048
PARTITION_OFFSET = FIRST_SECTOR * SECTOR
# The disk's GPT takes 33 sectors at its end; sgdisk ends the partition
# before them.
GPT_TAIL_SECTORS = 34
DEFAULT_PARTITION_GUID = "0FAB1E5D-3C2B-4A19-8E7F-60C5D4B3A291"

BOOT_DIR = "EFI/BOOT"
PLATFORM_NAME = "BOOTX64.EFI"
LOADER_NAME = "nimbboot.efi"
CONFIG_NAME = "platform.cfg"
TIMES_NAME = "platform.times"

# The boot device path of the partition on QEMU's q35 machine when the image
# is its first drive (-drive format=raw,file=...): the AHCI controller at
# PCI 1f.2, SATA port 0, then the partition's hard-drive node.
Q35_SATA_PREFIX = bytes.fromhex(
    "02010c00d041030a00000000"  # PciRoot(0x0)
    "01010600021f"  # Pci(0x1f,0x2)
    "03120a000000ffff0000"  # Sata(0x0,0xFFFF,0x0)
)


# platform.cfg of a stick image, for a real PC: nothing that only the test
# machine needs.
STICK_CONFIG = """\
# platform.cfg: read by the platform layer (\\EFI\\BOOT\\BOOTX64.EFI) at start.
# One key=value a line; a '#' line is a comment. Every key: platform/README.md.

# The console mode the loader finds: graphics shows the boot screen (the
# loader's messages then go to the serial port only); text shows them.
console=graphics

# The loader's load options, for example a kernel's name and its arguments:
# options=Kernel=nimb_kernel -v

# When the loader comes back (no kernel started), its outcome is shown on the
# screen; 1 waits for a key there before going back to the firmware.
wait-key=1

# A variable for this boot only, gone when the machine restarts:
# nvram-volatile.boot-args=-v
"""
# Room beyond the contents of a stick image, for FAT32's tables and slack.
STICK_SLACK_BYTES = 24 << 20


def stick_bytes(volume):
    """The size of a stick image for `volume`: its files and a margin,
    whole MiB, at least the default disk's size."""
    contents = sum(path.stat().st_size for path in walk(Path(volume)) if path.is_file())
    return max(DISK_BYTES, (contents * 9 // 8 + STICK_SLACK_BYTES + (1 << 20) - 1) >> 20 << 20)


class DiskError(Exception):
    """The image cannot be made; the text says why."""


# --- exact times ------------------------------------------------------------------------


def efi_time_text(ns):
    """A time in nanoseconds since 1970 (UTC) as the table writes it:
    `YYYY-MM-DD hh:mm:ss.nnnnnnnnn`."""
    seconds, nanoseconds = divmod(ns, 1_000_000_000)
    moment = datetime.datetime(1970, 1, 1) + datetime.timedelta(seconds=seconds)
    return f"{moment:%Y-%m-%d %H:%M:%S}.{nanoseconds:09d}"


def parse_time(text):
    """`YYYY-MM-DD hh:mm:ss[.fraction]` (UTC) as nanoseconds since 1970."""
    found = re.fullmatch(r"(\d{4}-\d\d-\d\d \d\d:\d\d:\d\d)(?:\.(\d{1,9}))?", text.strip())
    if not found:
        raise ValueError(f"not a time of the form YYYY-MM-DD hh:mm:ss[.n]: {text!r}")
    moment = datetime.datetime.strptime(found.group(1), "%Y-%m-%d %H:%M:%S")
    seconds = (moment - datetime.datetime(1970, 1, 1)) // datetime.timedelta(seconds=1)
    return seconds * 1_000_000_000 + int((found.group(2) or "0").ljust(9, "0"))


def set_time(path, ns):
    """Sets the host file's (or directory's) modification time exactly."""
    os.utime(path, ns=(ns, ns), follow_symlinks=False)


def times_table(volume):
    """The table's text for every file and directory under `volume`, from
    the host's own modification times: one line each, the time then the
    path from the volume's root with backslashes."""
    lines = ["# exact modification times (UTC) of the volume's files, for the platform layer\n"]
    for path in sorted(walk(volume)):
        relative = "\\" + "\\".join(path.relative_to(volume).parts)
        lines.append(f"{efi_time_text(path.lstat().st_mtime_ns)} {relative}\n")
    return "".join(lines)


def walk(volume):
    """Every file and directory under `volume`, parents before children."""
    for directory, names, files in os.walk(volume):
        names.sort()
        for name in names + sorted(files):
            yield Path(directory) / name


# --- device paths ----------------------------------------------------------------------


def partition_sectors(disk_bytes):
    return disk_bytes // SECTOR - GPT_TAIL_SECTORS - FIRST_SECTOR + 1


def hard_drive_node(partition_guid, disk_bytes=DISK_BYTES):
    """The firmware's hard-drive node of the image's partition: number 1,
    its start and size in sectors, the GUID as signature, GPT."""
    signature = uuid.UUID(partition_guid).bytes_le
    body = struct.pack("<IQQ16sBB", 1, FIRST_SECTOR, partition_sectors(disk_bytes), signature, 2, 2)
    return struct.pack("<BBH", 4, 1, 4 + len(body)) + body


def boot_device_path(partition_guid=DEFAULT_PARTITION_GUID, disk_bytes=DISK_BYTES, prefix=Q35_SATA_PREFIX):
    """The bytes of the device path that the loader finds for its device on
    QEMU's q35 machine, end node included."""
    return prefix + hard_drive_node(partition_guid, disk_bytes) + bytes.fromhex("7fff0400")


# --- the image --------------------------------------------------------------------------


def run_tool(*args):
    env = dict(os.environ, MTOOLS_SKIP_CHECK="1")
    try:
        subprocess.run(args, check=True, stdout=subprocess.DEVNULL, stderr=subprocess.PIPE, env=env)
    except FileNotFoundError as error:
        raise DiskError(f"{args[0]} is not installed (packages gdisk and mtools)") from error
    except subprocess.CalledProcessError as error:
        detail = error.stderr.decode(errors="replace").strip()
        raise DiskError(f"{args[0]} failed: {detail}") from error


def raw_partition_lba(disk_bytes=DISK_BYTES):
    """Where a raw second partition begins: 1 MiB before `disk_bytes`, the
    system partition ending in front of it."""
    return disk_bytes // SECTOR - FIRST_SECTOR


def build_disk(image, volume, platform, loader, config=None, disk_bytes=DISK_BYTES,
               partition_guid=DEFAULT_PARTITION_GUID, times=True, raw=None, raw_guid=None):
    """Writes the disk image `image` from the directory `volume`, with the
    platform layer and the loader (host paths; a loader of None leaves it
    out), `config` as platform.cfg (text; None: the volume's own, or none)
    and, with `times`, the table of exact times. With `raw` (the path of a
    partition image), a second partition of the GUID `raw_guid` holds its
    bytes at raw_partition_lba(), and the disk grows by its size. Raises
    DiskError."""
    image, volume = Path(image).resolve(), Path(volume).resolve()
    if not volume.is_dir():
        raise DiskError(f"{volume} is not a directory")
    for what, path in (("platform layer", platform), ("loader", loader)):
        if path is not None and not Path(path).is_file():
            raise DiskError(f"the {what} {path} is missing: build the EFI programs first")
    if disk_bytes < 40 << 20 or disk_bytes % SECTOR:
        raise DiskError(f"a disk of {disk_bytes} bytes is too small for FAT32 (40 MiB at least)")
    generated = {f"{BOOT_DIR}/{PLATFORM_NAME}": Path(platform)}
    if loader is not None:
        generated[f"{BOOT_DIR}/{LOADER_NAME}"] = Path(loader)
    if config is not None:
        generated[f"{BOOT_DIR}/{CONFIG_NAME}"] = config
    if times:
        generated[f"{BOOT_DIR}/{TIMES_NAME}"] = times_table(volume)
    clashes = [path for path in generated if (volume / path).exists() and path.endswith((PLATFORM_NAME, LOADER_NAME))]
    if clashes:
        raise DiskError(f"the volume has its own {', '.join(clashes)}: mkdisk puts them there")

    raw_bytes = (Path(raw).stat().st_size + SECTOR - 1) // SECTOR * SECTOR if raw else 0
    with open(image, "wb") as disk:
        disk.truncate(disk_bytes + raw_bytes)
    # A fresh image has nothing to zap, and each of sgdisk's steps costs a
    # second of waiting for the kernel to reread the table.
    layout, size = ["-n", f"1:{FIRST_SECTOR}:0"], []
    if raw:
        start = raw_partition_lba(disk_bytes)
        layout = ["-n", f"1:{FIRST_SECTOR}:{start - 1}", "-n", f"2:{start}:{start + raw_bytes // SECTOR - 1}",
                  "-u", f"2:{raw_guid}"]  # fmt: skip
        size = ["-T", str(start - FIRST_SECTOR)]
    run_tool("sgdisk", "-o", *layout, "-t", "1:EF00", "-u", f"1:{partition_guid}", str(image))
    target = f"{image}@@{PARTITION_OFFSET}"
    run_tool("mformat", "-i", target, *size, "-F", "-v", "ESP", "::")
    if raw:
        with open(image, "r+b") as disk, open(raw, "rb") as source:
            disk.seek(raw_partition_lba(disk_bytes) * SECTOR)
            shutil.copyfileobj(source, disk)

    entries = [(path.relative_to(volume).as_posix(), path) for path in walk(volume)]
    directories = {path for path, source in entries if source.is_dir()}
    files = {path: source for path, source in entries if not source.is_dir()}
    with tempfile.TemporaryDirectory(prefix="mkdisk-") as staging:
        for path, content in generated.items():
            if not isinstance(content, Path):
                source = Path(staging) / Path(path).name
                source.write_text(content)
                content = source
            files[path] = content
        for path in files:
            parts = path.split("/")
            directories.update("/".join(parts[:i]) for i in range(1, len(parts)))
        for directory in sorted(directories, key=lambda d: (d.count("/"), d)):
            run_tool("mmd", "-i", target, f"::/{directory}")
        for path in sorted(files):
            run_tool("mcopy", "-m", "-i", target, str(Path(files[path]).resolve()), f"::/{path}")
    return image


# --- command line -----------------------------------------------------------------------


def main(argv=None):
    parser = argparse.ArgumentParser(prog="mkdisk", description=__doc__,
                                     formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("volume", nargs="?", help="the directory whose contents make the partition")
    parser.add_argument("-o", "--output", help="the disk image to write")
    parser.add_argument("--efi-dir", default=str(DEFAULT_EFI_DIR), help="where BOOTX64.efi and nimbboot.efi are")
    parser.add_argument("--platform", help="the platform layer (default: EFI-DIR/BOOTX64.efi)")
    parser.add_argument("--loader", help="the loader (default: EFI-DIR/nimbboot.efi)")
    parser.add_argument("--config", help="platform.cfg to use (default: the volume's own EFI/BOOT/platform.cfg)")
    parser.add_argument("--set", action="append", default=[], metavar="KEY=VALUE",
                        help="a line of platform.cfg, behind those of --config (repeatable)")
    parser.add_argument("--size", type=int, metavar="MIB",
                        help=f"the image's size in MiB (default {DISK_BYTES >> 20}; with --stick sized to the volume)")
    parser.add_argument("--stick", action="store_true",
                        help="an image for a USB stick and a real PC: a platform.cfg without test keys unless the "
                             "volume or --config has one")
    parser.add_argument("--partition-guid", default=DEFAULT_PARTITION_GUID, help="the partition's GUID")
    parser.add_argument("--no-times", action="store_true", help="no exact times: the firmware's 2-second ones")
    parser.add_argument("--boot-path", action="store_true",
                        help="print the loader's boot device path on QEMU q35 in hex (for kcache --boot-path-hex)")
    args = parser.parse_args(argv)
    try:
        uuid.UUID(args.partition_guid)
    except ValueError:
        parser.error(f"--partition-guid {args.partition_guid!r} is no GUID")
    if args.size is not None and args.size <= 0:
        parser.error("--size must be positive")
    if args.boot_path:
        args.size = args.size or DISK_BYTES >> 20
        print(boot_device_path(args.partition_guid, args.size << 20).hex())
        if args.volume is None:
            return 0
    if args.volume is None or args.output is None:
        parser.error("a volume directory and -o IMAGE are needed")
    for line in args.set:
        if "=" not in line:
            parser.error(f"--set {line!r}: no '='")
    config = None
    try:
        if args.config is not None:
            config = Path(args.config).read_text()
        elif (args.set or args.stick) and (Path(args.volume) / BOOT_DIR / CONFIG_NAME).is_file():
            config = (Path(args.volume) / BOOT_DIR / CONFIG_NAME).read_text()
        elif args.stick:
            config = STICK_CONFIG
        if args.set:
            config = (config or "") + ("" if not config or config.endswith("\n") else "\n")
            config += "".join(f"{line}\n" for line in args.set)
        efi_dir = Path(args.efi_dir)
        size = args.size << 20 if args.size else stick_bytes(args.volume) if args.stick else DISK_BYTES
        build_disk(args.output, args.volume, args.platform or efi_dir / "BOOTX64.efi",
                   args.loader or efi_dir / "nimbboot.efi", config, size, args.partition_guid,
                   not args.no_times)
    except (DiskError, OSError) as error:
        print(f"mkdisk: {error}", file=sys.stderr)
        return 1
    return 0


if __name__ == "__main__":
    sys.exit(main())
