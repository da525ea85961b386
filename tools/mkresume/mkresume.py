#!/usr/bin/env python3
"""mkresume: writes a hibernation image onto a raw partition image, and the
NVRAM settings that ask the loader to restart it.

The image is laid out as the loader reads it: the 512-byte header, the
extent list (its first 32 bytes inside the header), the restart code taken
from a 32-bit ELF executable, an optional preview section holding a preview
picture encoded from a PNG or PPM file, and filler up to the first stage's
end. Its bytes are spread over the partition in extents, out of order; from
--encrypted-offset on, the first stage is AES-CBC encrypted (openssl enc)
with the fixed initialisation vector.

The NVRAM settings come out in the platform layer's configuration form:
nvram-hex.boot-signature, nvram-hex.boot-image (a hard-drive node for the
partition, a file-path node with the header's offset in hexadecimal, an end
node) and nvram-hex.boot-image-key.

When the restart code holds the restart probe's expectation record (it
begins with the marker RPRBEXP1), the record is filled in: the key (masked),
the header as written, the first stage's checksum, the bar's final step,
the screen and the save table that the loader should leave.

Example:
  mkresume.py --restart resume_probe.elf --partition part.img \\
      --partition-guid 6A1E1F10-... --partition-number 2 --key-bytes 32 \\
      --first-stage 1M --preview screen.ppm --nvram-out resume.cfg
"""

import argparse
import dataclasses
import os
import random
import struct
import subprocess
import sys
import uuid
import zlib
from pathlib import Path

MAGIC = 0x73696D65
HEADER_BYTES = 512
EXTENTS_OFFSET = 0x1E0
PAGE = 4096
# The fixed initialisation vector, in memory order.
IV = bytes.fromhex("5d2c81f0e47a96b3c60d1fa8723e49b5")
PROBE_MARKER = b"RPRBEXP1"
KEY_MASK = 0xA5
LOGO_BACKGROUND = 191

# Header fields: name -> (offset, struct format).
FIELDS = {
    "imageBytes": (0x000, "<Q"),
    "firstStageBytes": (0x008, "<Q"),
    "restorePage": (0x010, "<I"),
    "restorePageCount": (0x014, "<I"),
    "restoreEntryOffset": (0x018, "<I"),
    "restoreSum": (0x034, "<I"),
    "magic": (0x04C, "<I"),
    "runtimePage": (0x054, "<I"),
    "runtimePageCount": (0x058, "<I"),
    "encryptedOffset": (0x06C, "<Q"),
    "machineSignature": (0x074, "<Q"),
    "previewBytes": (0x07C, "<I"),
    "previewPictureOffset": (0x080, "<I"),
    "extentBytes": (0x1DC, "<I"),
}

# The progress bar: cell mask, geometry, levels.
CELL_MASK = (
    (0, 99, 216, 240, 216, 99, 0),
    (81, 255, 255, 255, 255, 255, 81),
    (174, 255, 255, 255, 255, 255, 174),
    *((195, 255, 255, 255, 255, 255, 195),) * 10,
    (174, 255, 255, 255, 255, 255, 174),
    (84, 255, 255, 255, 255, 255, 84),
    (0, 102, 219, 243, 219, 102, 0),
)
CELLS = 19
CELL_PITCH = 10
BAR_WIDTH = 190
BAR_FROM_BOTTOM = 97


class UsageError(Exception):
    """A problem with the command line or an input file, said in words."""


def number(text):
    """A size or address: decimal or 0x hex, with an optional K, M or G."""
    scale = {"K": 1 << 10, "M": 1 << 20, "G": 1 << 30}.get(text[-1:].upper(), 1)
    try:
        return int(text[:-1] if scale != 1 else text, 0) * scale
    except ValueError:
        raise argparse.ArgumentTypeError(f"not a number: {text!r}") from None


# --- pictures ---------------------------------------------------------------------------


@dataclasses.dataclass
class Picture:
    width: int
    height: int
    rows: list  # rows of (r, g, b) tuples


def read_ppm(data):
    fields, position = [], 2
    while len(fields) < 3:
        while data[position : position + 1].isspace():
            position += 1
        if data[position : position + 1] == b"#":
            position = data.index(b"\n", position)
            continue
        start = position
        while not data[position : position + 1].isspace():
            position += 1
        fields.append(int(data[start:position]))
    width, height, maximum = fields
    if maximum != 255:
        raise UsageError("PPM: only 8-bit samples are read")
    pixels = data[position + 1 : position + 1 + width * height * 3]
    if len(pixels) != width * height * 3:
        raise UsageError("PPM: the file ends early")
    rows = [[tuple(pixels[(y * width + x) * 3 : (y * width + x) * 3 + 3]) for x in range(width)] for y in range(height)]
    return Picture(width, height, rows)


def paeth(a, b, c):
    p = a + b - c
    pa, pb, pc = abs(p - a), abs(p - b), abs(p - c)
    return a if pa <= pb and pa <= pc else b if pb <= pc else c


def read_png(data):
    position, chunks = 8, {}
    idat = b""
    while position < len(data):
        length, kind = struct.unpack(">I4s", data[position : position + 8])
        body = data[position + 8 : position + 8 + length]
        if kind == b"IDAT":
            idat += body
        else:
            chunks.setdefault(kind, body)
        position += 12 + length
    width, height, depth, colour, _, _, interlace = struct.unpack(">IIBBBBB", chunks[b"IHDR"])
    channels = {2: 3, 6: 4, 0: 1, 4: 2}.get(colour)
    if depth != 8 or channels is None or interlace:
        raise UsageError("PNG: only 8-bit grey, RGB or RGBA pictures without interlacing are read")
    raw, stride = zlib.decompress(idat), width * channels
    rows, previous, position = [], bytearray(stride), 0
    for _ in range(height):
        kind, line = raw[position], bytearray(raw[position + 1 : position + 1 + stride])
        position += 1 + stride
        for i in range(stride):
            left = line[i - channels] if i >= channels else 0
            up, corner = previous[i], previous[i - channels] if i >= channels else 0
            line[i] = (line[i] + (0, left, up, (left + up) // 2, paeth(left, up, corner))[kind]) & 0xFF
        previous = line
        if channels >= 3:
            rows.append([tuple(line[x * channels : x * channels + 3]) for x in range(width)])
        else:
            rows.append([(line[x * channels],) * 3 for x in range(width)])
    return Picture(width, height, rows)


def read_picture(path):
    data = Path(path).read_bytes()
    if data.startswith(b"\x89PNG\r\n\x1a\n"):
        return read_png(data)
    if data.startswith(b"P6"):
        return read_ppm(data)
    raise UsageError(f"{path}: neither a PNG nor a binary PPM (P6) file")


def pixel_value(rgb, bytes_per_pixel):
    r, g, b = rgb
    if bytes_per_pixel == 4:
        return r << 16 | g << 8 | b
    return (r >> 3) << 10 | (g >> 3) << 5 | (b >> 3)


# The preview encoder (tools/resume/preview_encoder.cpp, the one the unit
# tests decode with the loader's own code) as a program of the host build.
PREVIEW_ENCODE = os.environ.get("PREVIEW_ENCODE") or os.path.join(
    os.path.dirname(os.path.abspath(__file__)), "..", "..", "build", "tools", "preview_encode")


def encode_preview(picture, bytes_per_pixel):
    """The preview picture in the run-length format, made by the host
    build's preview_encode (PREVIEW_ENCODE names another)."""
    pixels = b"".join(struct.pack("<I", pixel_value(rgb, bytes_per_pixel)) for row in picture.rows for rgb in row)
    try:
        result = subprocess.run([PREVIEW_ENCODE, str(picture.width), str(picture.height), str(bytes_per_pixel)],
                                input=pixels, capture_output=True, check=False)
    except OSError as error:
        raise UsageError(f"no preview encoder at {PREVIEW_ENCODE} ({error}): build the host tools") from error
    if result.returncode != 0:
        raise UsageError(result.stderr.decode(errors="replace").strip())
    return result.stdout


def grey_sample(value, bytes_per_pixel):
    """A pixel of the preview as the loader greys it."""
    if bytes_per_pixel == 4:
        luma = (13933 * (value >> 24 & 0xFF) + 46871 * (value >> 16 & 0xFF) + 4732 * (value & 0xFF)) >> 16
    else:
        luma = (13933 * (value >> 10 & 0x1F) + 46871 * (value >> 5 & 0x1F) + 4732 * (value & 0x1F)) >> 13
    return (luma * 19661 + 0x670000) >> 16


def blurred_grey(picture, bytes_per_pixel, x, y):
    """The grey level that the 5 x 5 binomial blur gives at (x, y): samples
    left of and above the picture count as 0, right of and below it repeat
    the last."""
    weights = (1, 4, 6, 4, 1)
    total = 0
    for dy in range(5):
        sy = y + dy - 2
        if sy < 0:
            continue
        row = picture.rows[min(sy, picture.height - 1)]
        for dx in range(5):
            sx = x + dx - 2
            if sx < 0:
                continue
            value = pixel_value(row[min(sx, picture.width - 1)], bytes_per_pixel)
            total += weights[dy] * weights[dx] * grey_sample(value, bytes_per_pixel)
    return (total + 128) >> (8 if bytes_per_pixel == 4 else 11) & (0xFF if bytes_per_pixel == 4 else 0x1F)


def expected_save_table(picture, bytes_per_pixel, width, height):
    """The bar's background samples, cell by cell, over the blurred preview
    (None: over the logo's grey background)."""
    left, top = (width - BAR_WIDTH) // 2, height - BAR_FROM_BOTTOM
    table = bytearray()
    for cell in range(CELLS):
        for row, alphas in enumerate(CELL_MASK):
            for column, alpha in enumerate(alphas):
                if alpha in (0, 255):
                    continue
                if picture is None:
                    table.append(LOGO_BACKGROUND)
                    continue
                grey = blurred_grey(picture, bytes_per_pixel, left + cell * CELL_PITCH + column, top + row)
                table.append(grey if bytes_per_pixel == 4 else (grey * 8 | grey >> 2))
    return bytes(table)


# --- the restart code ---------------------------------------------------------------------


@dataclasses.dataclass
class RestartCode:
    page: int
    pages: int
    entry_offset: int
    data: bytearray


def read_restart_elf(path):
    data = Path(path).read_bytes()
    if data[:4] != b"\x7fELF" or data[4] != 1 or data[5] != 1:
        raise UsageError(f"{path}: not a 32-bit little-endian ELF file")
    entry, phoff = struct.unpack_from("<II", data, 0x18)
    phentsize, phnum = struct.unpack_from("<HH", data, 0x2A)
    loads = []
    for i in range(phnum):
        kind, offset, vaddr, _, filesz, memsz, _, _ = struct.unpack_from("<8I", data, phoff + i * phentsize)
        if kind == 1 and memsz:
            loads.append((vaddr, offset, filesz, memsz))
    if not loads:
        raise UsageError(f"{path}: no loadable segment")
    base = min(v for v, _, _, _ in loads) & ~(PAGE - 1)
    end = max(v + m for v, _, _, m in loads)
    pages = (end - base + PAGE - 1) // PAGE
    image = bytearray(pages * PAGE)
    for vaddr, offset, filesz, _ in loads:
        image[vaddr - base : vaddr - base + filesz] = data[offset : offset + filesz]
    if not base <= entry < end:
        raise UsageError(f"{path}: the entry 0x{entry:x} lies outside the loaded segments")
    return RestartCode(base // PAGE, pages, entry - base, image)


# --- the image ----------------------------------------------------------------------------


def adler32_pages(code):
    """The loader's restoreSum: Adler-32 of each page by itself, summed."""
    total = 0
    for start in range(0, len(code), PAGE):
        total = (total + zlib.adler32(bytes(code[start : start + PAGE]))) & 0xFFFFFFFF
    return total


def encrypt(data, key):
    if not data:
        return b""
    result = subprocess.run(
        ["openssl", "enc", f"-aes-{len(key) * 8}-cbc", "-K", key.hex(), "-iv", IV.hex(), "-nopad"],
        input=bytes(data),
        capture_output=True,
        check=False,
    )
    if result.returncode != 0 or len(result.stdout) != len(data):
        raise UsageError(f"openssl enc failed: {result.stderr.decode(errors='replace').strip()}")
    return result.stdout


def plan_extents(first_stage, header_offset, extent_bytes, area_start, rng):
    """Extents of uneven lengths that cover the first stage, the first one at
    the header's offset, the others shuffled over the slots behind it."""
    lengths, left = [], first_stage
    while left:
        length = min(left, max(512, rng.randrange(extent_bytes // 2, extent_bytes + 1) // 512 * 512))
        lengths.append(length)
        left -= length
    slots = list(range(1, len(lengths)))
    rng.shuffle(slots)
    starts = [header_offset]
    for slot in slots:
        starts.append(area_start + slot * extent_bytes)
    return list(zip(starts, lengths))


def put(header, name, value):
    offset, form = FIELDS[name]
    struct.pack_into(form, header, offset, value & ((1 << (8 * struct.calcsize(form))) - 1))


def device_path(partition_number, partition_guid, start_lba, size_lbas, offset_text):
    hard_drive = struct.pack(
        "<BBHIQQ16sBB", 4, 1, 42, partition_number, start_lba, size_lbas, uuid.UUID(partition_guid).bytes_le, 2, 2
    )
    path = (offset_text + "\0").encode("utf-16-le")
    file_path = struct.pack("<BBH", 4, 4, 4 + len(path)) + path
    return hard_drive + file_path + bytes((0x7F, 0xFF, 4, 0))


def build(args):
    rng = random.Random(args.seed)
    code = read_restart_elf(args.restart)
    key = bytes.fromhex(args.key) if args.key else rng.randbytes(args.key_bytes) if args.key_bytes else b""
    if len(key) not in (0, 16, 24, 32):
        raise UsageError(f"a key of {len(key)} bytes: AES takes 16, 24 or 32")

    preview, picture = b"", None
    if args.preview:
        picture = read_picture(args.preview)
        preview = bytes(args.preview_picture_offset) + encode_preview(picture, args.preview_depth // 8)
    restore_bytes = code.pages * PAGE
    first_stage = args.first_stage
    # The list's length depends on the number of extents, which depends on
    # the first stage's size; the size is fixed, so one plan settles it.
    extents = plan_extents(first_stage, args.header_offset, args.extent_bytes, args.area_start, rng)
    extent_count = len(extents)
    extent_bytes = 16 * extent_count
    if args.extent_bytes_field is not None:
        extent_bytes = args.extent_bytes_field
    preview_end = EXTENTS_OFFSET + 16 * extent_count + restore_bytes + len(preview)
    if preview_end > first_stage:
        raise UsageError(f"the first stage of {first_stage} bytes cannot hold the {preview_end} bytes in front")
    encrypted = args.encrypted_offset
    if encrypted is None:
        encrypted = 0 if not key else first_stage - (first_stage - preview_end) // 16 * 16
    if encrypted and (encrypted >= first_stage or (first_stage - encrypted) % 16):
        raise UsageError("--encrypted-offset must lie below the first stage's end, a multiple of 16 from it")

    image = bytearray(rng.randbytes(first_stage))
    header = bytearray(rng.randbytes(HEADER_BYTES))
    values = {
        "imageBytes": args.image_bytes or first_stage,
        "firstStageBytes": first_stage,
        "restorePage": code.page,
        "restorePageCount": code.pages,
        "restoreEntryOffset": code.entry_offset,
        "restoreSum": 0,
        "magic": MAGIC,
        "runtimePage": args.runtime_page >> 12,
        "runtimePageCount": args.runtime_pages,
        "encryptedOffset": encrypted,
        "machineSignature": args.machine_signature,
        "previewBytes": len(preview),
        "previewPictureOffset": args.preview_picture_offset if preview else 0,
        "extentBytes": extent_bytes,
    }
    for name, value in values.items():
        put(header, name, value)
    struct.pack_into("<III", header, 0x94, 0, 0, 0)
    struct.pack_into("<II", header, 0xA0, 0, 0)
    for assignment in args.set:
        name, _, value = assignment.partition("=")
        if name not in FIELDS:
            raise UsageError(f"--set {name}: no such header field ({', '.join(FIELDS)})")
        put(header, name, number(value))
    listed = list(extents)
    for override in args.set_extent:
        index, start, length = (number(part) for part in override.split(":"))
        while len(listed) <= index:
            listed.append((0, 0))
        listed[index] = (start, length)
    image[:HEADER_BYTES] = header
    extent_list = b"".join(struct.pack("<QQ", s, n) for s, n in listed)
    image[EXTENTS_OFFSET : EXTENTS_OFFSET + len(extent_list)] = extent_list
    code_at = EXTENTS_OFFSET + 16 * extent_count
    preview_at = code_at + restore_bytes

    image[preview_at : preview_at + len(preview)] = preview
    fill_probe_record(code, args, key, image, first_stage, code_at, restore_bytes, values, extent_count,
                      len(preview), picture)
    image[code_at : code_at + restore_bytes] = code.data
    plain = bytearray(image)
    if encrypted:
        image[encrypted:] = encrypt(image[encrypted:], key)
    fill_chain_block(code, image, code_at, restore_bytes, encrypted)
    plain[code_at : code_at + restore_bytes] = code.data

    write_partition(args, extents, image)
    return key, plain, extents


def fill_probe_record(code, args, key, image, first_stage, code_at, restore_bytes, values, extent_count,
                      preview_bytes, picture):
    """Fills the restart probe's expectation record, when the restart code
    has one."""
    at = code.data.find(PROBE_MARKER)
    if at < 0:
        return
    checked = image[HEADER_BYTES:code_at] + image[code_at + restore_bytes :]
    image_bytes = values["imageBytes"]
    if preview_bytes:
        preview_stage = preview_bytes + restore_bytes + 16 * extent_count - 32
        main_stage = first_stage - HEADER_BYTES - preview_stage
        step = main_stage * CELLS // (image_bytes - preview_stage)
    else:
        step = (first_stage - HEADER_BYTES) * CELLS // image_bytes
    width, height = args.screen
    fits = picture is not None and (picture.width, picture.height, args.preview_depth) == (width, height, 32)
    table = expected_save_table(picture if fits else None, 4, width, height)
    record = bytearray(8 + 4 + 32 + 4 * 8 + 16 + 722 + 2 + 512)
    struct.pack_into("<8sI", record, 0, PROBE_MARKER, len(key))
    record[12 : 12 + len(key)] = bytes(b ^ KEY_MASK for b in key)
    struct.pack_into(
        "<IIIIIIII", record, 44, zlib.adler32(bytes(checked)), min(step, CELLS), width, height, 32,
        1 if fits else 0, args.descriptor_size, first_stage,
    )
    # The chain block (16 bytes at 76) is filled once the image is encrypted.
    record[92 : 92 + 722] = table
    record[816 : 816 + 512] = image[:HEADER_BYTES]
    code.data[at : at + len(record)] = record


def fill_chain_block(code, image, code_at, restore_bytes, encrypted):
    """The last block of the first stage as the disk holds it, in the
    probe's record. The record lies in the restart code, which lies before
    the encrypted part, so patching it leaves the ciphertext valid."""
    at = code.data.find(PROBE_MARKER)
    if at < 0:
        return
    if encrypted and encrypted < code_at + restore_bytes:
        raise UsageError("with the restart probe, encryption must begin behind the restart code")
    code.data[at + 76 : at + 92] = image[-16:]
    code.data[at + 814] = 1 if encrypted else 0
    image[code_at : code_at + restore_bytes] = code.data


def write_partition(args, extents, image):
    end = max(start + length for start, length in extents)
    size = max(args.partition_bytes or 0, (end + PAGE - 1) // PAGE * PAGE)
    with open(args.partition, "wb") as out:
        out.truncate(size)
        position = 0
        for start, length in extents:
            out.seek(start)
            out.write(image[position : position + length])
            position += length


def nvram_lines(args, key):
    lines = []
    if not args.no_signature:
        lines.append("nvram-hex.boot-signature=" + bytes(4).hex())
    if not args.no_boot_image:
        text = ("0x" if args.hex_prefix else "") + f"{args.header_offset:x}"
        path = device_path(args.partition_number, args.partition_guid, args.partition_start_lba,
                           args.partition_lbas, text)
        lines.append("nvram-hex.boot-image=" + path.hex())
    if key and not args.no_key_variable:
        lines.append("nvram-hex.boot-image-key=" + key.hex())
    return lines


def timed_read_line(args, extents):
    request = struct.pack("<I", args.partition_number) + b"".join(struct.pack("<QQ", s, n) for s, n in extents)
    return "time-read-extents-hex=" + request.hex()


def parse_args(argv):
    parser = argparse.ArgumentParser(description=__doc__, formatter_class=argparse.RawDescriptionHelpFormatter)
    parser.add_argument("--restart", required=True, help="the restart code: a 32-bit ELF executable")
    parser.add_argument("--partition", required=True, help="the raw partition image to write (made or overwritten)")
    parser.add_argument("--partition-bytes", type=number, help="size of the partition image (at least what it holds)")
    parser.add_argument("--partition-number", type=int, default=2, help="GPT partition number, from 1 (2)")
    parser.add_argument("--partition-guid", help="the partition's unique GUID (for boot-image)")
    parser.add_argument("--partition-start-lba", type=number, default=0, help="for the hard-drive node only")
    parser.add_argument("--partition-lbas", type=number, default=0, help="for the hard-drive node only")
    parser.add_argument("--header-offset", type=number, default=0x10000, help="byte offset of the header (0x10000)")
    parser.add_argument("--hex-prefix", action="store_true", help="write the offset text as 0x...")
    parser.add_argument("--area-start", type=number, default=0x20000, help="where the other extents' slots begin")
    parser.add_argument("--extent-bytes", type=number, default=64 << 10, help="largest extent (64K)")
    parser.add_argument("--first-stage", type=number, default=1 << 20, help="firstStageBytes (1M)")
    parser.add_argument("--image-bytes", type=number, help="imageBytes (default: the first stage)")
    parser.add_argument("--key", help="the AES key in hexadecimal (16, 24 or 32 bytes)")
    parser.add_argument("--key-bytes", type=int, choices=(16, 24, 32), help="a random key of this size")
    parser.add_argument("--encrypted-offset", type=number,
                        help="encryptedOffset (default with a key: the first 16-byte step behind the preview)")
    parser.add_argument("--preview", help="a PNG or PPM picture for the preview section")
    parser.add_argument("--preview-depth", type=int, choices=(16, 32), default=32, help="bits per pixel (32)")
    parser.add_argument("--preview-picture-offset", type=number, default=16,
                        help="where the picture begins in the preview section (16)")
    # OVMF (512 MiB) leaves 1 MiB to 8 MiB free and has 0x386 pages of
    # runtime code and data: the area lies behind the restart probe.
    parser.add_argument("--runtime-page", type=number, default=0x430000,
                        help="address of the runtime area (0x430000)")
    parser.add_argument("--runtime-pages", type=number, default=0x3D0, help="pages of the runtime area (0x3D0)")
    parser.add_argument("--machine-signature", type=number, default=0, help="machineSignature (0)")
    parser.add_argument("--screen", type=lambda t: tuple(int(v) for v in t.split("x")), default=(1280, 800),
                        help="WIDTHxHEIGHT of the screen, for the probe's expectations (1280x800)")
    parser.add_argument("--descriptor-size", type=int, default=48, help="the firmware's memory descriptor size")
    parser.add_argument("--set", action="append", default=[], metavar="FIELD=VALUE",
                        help="write a header field as given, after the layout (repeatable)")
    parser.add_argument("--set-extent", action="append", default=[], metavar="INDEX:START:LENGTH",
                        help="write an entry of the extent list as given (repeatable)")
    parser.add_argument("--extent-bytes-field", type=number, help="extentBytes as written, instead of the list's size")
    parser.add_argument("--no-signature", action="store_true", help="leave boot-signature out of the settings")
    parser.add_argument("--no-boot-image", action="store_true", help="leave boot-image out of the settings")
    parser.add_argument("--no-key-variable", action="store_true", help="leave boot-image-key out of the settings")
    parser.add_argument("--nvram-out", help="write the settings there (default: standard output)")
    parser.add_argument("--timed-read", action="store_true", help="add time-read-extents-hex: the platform reads the extents, timed")
    parser.add_argument("--plain-out", help="write the first stage as the loader should leave it")
    parser.add_argument("--seed", type=int, default=1, help="seed of the layout and the filler (1)")
    args = parser.parse_args(argv)
    if not args.no_boot_image and not args.partition_guid:
        parser.error("--partition-guid is needed for boot-image (or give --no-boot-image)")
    if args.key and args.key_bytes:
        parser.error("--key and --key-bytes exclude each other")
    if args.first_stage < HEADER_BYTES or args.extent_bytes < 1024 or args.extent_bytes % 512:
        parser.error("--first-stage is at least 512 and --extent-bytes a multiple of 512, at least 1024")
    if args.header_offset + args.extent_bytes > args.area_start:
        parser.error("--area-start must lie behind the first extent (--header-offset + --extent-bytes)")
    return args


def main(argv=None):
    args = parse_args(argv)
    try:
        key, plain, extents = build(args)
    except (UsageError, OSError) as error:
        print(f"mkresume: {error}", file=sys.stderr)
        return 1
    lines = nvram_lines(args, key)
    if args.timed_read:
        lines.append(timed_read_line(args, extents))
    text = "".join(line + "\n" for line in lines)
    if args.nvram_out:
        Path(args.nvram_out).write_text(text)
    else:
        sys.stdout.write(text)
    if args.plain_out:
        Path(args.plain_out).write_bytes(plain)
    return 0


if __name__ == "__main__":
    sys.exit(main())
