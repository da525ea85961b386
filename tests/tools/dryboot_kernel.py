#!/usr/bin/env python3
"""Writes a small kernel object for dryboot's tests: its text segment at
0x200000 (16 bytes of file), a thread command with the entry point, and
optionally a segment with no file bytes behind the text.

    dryboot_kernel.py OUTPUT ENTRY [ZERO_FILL_BYTES]
"""
import struct
import sys


def command(kind, length, words):
    body = struct.pack("<II", kind, length) + b"".join(struct.pack("<I", w) for w in words)
    return body.ljust(length, b"\0")


def main():
    output, entry = sys.argv[1], int(sys.argv[2], 0)
    zero_fill = int(sys.argv[3], 0) if len(sys.argv) > 3 else 0
    commands = [command(1, 56, [0, 0, 0, 0, 0x200000, 0x1000, 0x1000, 0x10, 7, 7])]
    if zero_fill:
        commands.append(command(1, 56, [0, 0, 0, 0, 0x201000, zero_fill, 0, 0, 7, 7]))
    # The thread's registers: flavour, count, then 16 words with the
    # instruction pointer as the eleventh.
    registers = [0] * 16
    registers[10] = entry
    commands.append(command(5, 80, [1, 16] + registers))
    body = b"".join(commands)
    header = struct.pack("<7I", 0xFEEDFACE, 7, 3, 2, len(commands), len(body), 0)
    data = (header + body).ljust(0x1000, b"\0") + bytes(range(16))
    with open(output, "wb") as out:
        out.write(data)


main()
