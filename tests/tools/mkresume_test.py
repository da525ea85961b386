"""mkresume's images: restarted through the loader's own TryResume with each
key size, the preview's runs, the NVRAM settings and the refusals."""

import os
import struct
import subprocess
import sys
import tempfile
import unittest
import uuid
from pathlib import Path

sys.path.insert(0, str(Path(__file__).resolve().parents[2] / "tools" / "mkresume"))
import mkresume  # noqa: E402

GUID = "6A1E1F10-2B3C-4D5E-8F90-A1B2C3D4E5F6"


def elf32(entry=0x400010, vaddr=0x400000, code=b"\x90" * 64, memsz=0x2100):
    """A minimal 32-bit ELF executable with one loadable segment."""
    header = bytearray(52)
    header[:7] = b"\x7fELF\x01\x01\x01"
    struct.pack_into("<HHIIIIIHHHHHH", header, 16, 2, 3, 1, entry, 52, 0, 0, 52, 32, 1, 40, 0, 0)
    segment = struct.pack("<8I", 1, 0x1000, vaddr, vaddr, len(code), memsz, 5, 0x1000)
    return bytes(header) + segment + bytes(0x1000 - 52 - 32) + code


class MkresumeTest(unittest.TestCase):
    def setUp(self):
        self.dir = Path(tempfile.mkdtemp(prefix="mkresume-test-"))
        (self.dir / "code.elf").write_bytes(elf32())

    def run_tool(self, *args):
        argv = ["--restart", str(self.dir / "code.elf"), "--partition", str(self.dir / "part.img"),
                "--partition-guid", GUID, "--nvram-out", str(self.dir / "nvram.cfg"),
                "--plain-out", str(self.dir / "plain.bin"), "--extent-bytes", "8K", *args]  # fmt: skip
        self.assertEqual(mkresume.main(argv), 0)
        settings = dict(line.split("=", 1) for line in (self.dir / "nvram.cfg").read_text().splitlines())
        return (self.dir / "part.img").read_bytes(), (self.dir / "plain.bin").read_bytes(), settings

    def test_preview_runs_decode_to_the_picture(self):
        picture = mkresume.Picture(5, 2, [[(1, 2, 3)] * 4 + [(9, 9, 9)], [(0, 0, 0), (255, 0, 0)] * 2 + [(7, 7, 7)]])
        for depth in (2, 4):
            data = mkresume.encode_preview(picture, depth)
            self.assertEqual(struct.unpack_from("<III", data), (depth, 5, 2))
            for y, row in enumerate(picture.rows):
                at, pixels = struct.unpack_from("<I", data, 12 + 4 * y)[0], []
                while len(pixels) < 5:
                    control = struct.unpack_from("<I", data, at)[0]
                    at += 4
                    count = control & 0xFFFFFF
                    values = [struct.unpack_from("<I" if depth == 4 else "<H", data, at + depth * i)[0]
                              for i in range(1 if control >> 24 else count)]  # fmt: skip
                    at += depth * len(values)
                    pixels += values * count if control >> 24 else values
                self.assertEqual(pixels, [mkresume.pixel_value(rgb, depth) for rgb in row])

    def test_boot_image_names_the_partition_and_the_offset(self):
        _, _, settings = self.run_tool("--partition-number", "3", "--header-offset", "0x20000",
                                       "--area-start", "0x30000", "--hex-prefix")  # fmt: skip
        path = bytes.fromhex(settings["nvram-hex.boot-image"])
        kind, subtype, length, number = struct.unpack_from("<BBHI", path)
        self.assertEqual((kind, subtype, length, number), (4, 1, 42, 3))
        self.assertEqual(path[24:40], uuid.UUID(GUID).bytes_le)
        self.assertEqual(path[40:42], b"\x02\x02")
        text_length = struct.unpack_from("<H", path, 44)[0]
        self.assertEqual(path[42:44], b"\x04\x04")
        self.assertEqual(path[46 : 42 + text_length].decode("utf-16-le"), "0x20000\0")
        self.assertEqual(path[42 + text_length :], b"\x7f\xff\x04\x00")
        self.assertNotIn("nvram-hex.boot-image-key", settings)

    @unittest.skipUnless(os.environ.get("MKRESUME_CHECK"), "MKRESUME_CHECK names no mkresume_check")
    def test_the_loader_restarts_each_key_size(self):
        # Through the loader's own TryResume: the gate is entered at the
        # restart code with the header, and the first stage is the plain one.
        for args in ((), ("--key-bytes", "16"), ("--key-bytes", "24"), ("--key-bytes", "32", "--extent-bytes", "4K")):
            with self.subTest(args):
                self.run_tool("--first-stage", "96K", *args)
                result = subprocess.run([os.environ["MKRESUME_CHECK"], str(self.dir / "part.img"),
                                         str(self.dir / "nvram.cfg"), str(self.dir / "plain.bin")],
                                        capture_output=True, text=True)  # fmt: skip
                self.assertEqual(result.returncode, 0, result.stdout + result.stderr)

    @unittest.skipUnless(os.environ.get("MKRESUME_CHECK"), "MKRESUME_CHECK names no mkresume_check")
    def test_the_loader_refuses_a_bad_magic_after_taking_the_key(self):
        self.run_tool("--key-bytes", "16", "--set", "magic=0x73696D66")
        result = subprocess.run([os.environ["MKRESUME_CHECK"], str(self.dir / "part.img"),
                                 str(self.dir / "nvram.cfg")], capture_output=True, text=True)  # fmt: skip
        self.assertEqual(result.returncode, 2, result.stdout + result.stderr)
        self.assertIn("boot-signature no, boot-image yes, boot-image-key no", result.stdout)

    def test_refusals_are_said_in_words(self):
        (self.dir / "text.elf").write_text("not an ELF file")
        for args, words in (
            (("--key", "00" * 20), "AES takes 16, 24 or 32"),
            (("--restart", str(self.dir / "text.elf")), "not a 32-bit little-endian ELF"),
            (("--first-stage", "4K"), "cannot hold"),
            (("--set", "colour=1"), "no such header field"),
        ):
            with self.assertRaises(mkresume.UsageError) as caught:
                mkresume.build(mkresume.parse_args(
                    ["--restart", str(self.dir / "code.elf"), "--partition", str(self.dir / "p.img"),
                     "--partition-guid", GUID, *args]))  # fmt: skip
            self.assertIn(words, str(caught.exception))


if __name__ == "__main__":
    unittest.main()
