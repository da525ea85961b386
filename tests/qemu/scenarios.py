"""The QEMU scenarios: each one a volume, the platform's configuration and
what the run must print and end with. harness.py runs them; CMakeLists.txt
registers one ctest test per name."""

import dataclasses
import functools
import re
import struct
import sys
from pathlib import Path

sys.path.insert(0, str(Path(__file__).resolve().parents[2] / "tools" / "mkdisk"))
sys.path.insert(0, str(Path(__file__).resolve().parents[2] / "tools" / "qemuboot"))
import mkdisk  # noqa: E402
from qemuboot import NET_MAC  # noqa: E402

KERNEL_ERROR = "Error loading kernel 'nimb_kernel'"

# What every scenario's platform.cfg starts with, unless the scenario says
# otherwise: the end through the debug-exit device and the platform records
# of the machine.
BASE_CONFIG = {
    "debug-exit": "1",
    "datahub.Model": "QEMU1,1",
    "datahub-hex.BusFrequency": "00e1f50500000000",  # 100 MHz, 64 bits
}

# The loader's configuration file on a volume boot.
BOOT_PLIST = "Library/Preferences/SystemConfiguration/com.quill.Boot.plist"

# The GUID of the system partition on every disk the harness builds: the
# root volume's UUID as the loader should find it. Its first three fields
# read differently in either byte order.
PARTITION_GUID = mkdisk.DEFAULT_PARTITION_GUID
# The raw partition that holds a resume image, behind the system partition.
RESUME_PARTITION_GUID = "6A1E1F10-2B3C-4D5E-8F90-A1B2C3D4E5F6"

# What a boot of the reference kernel prints, in this order.
LOADING_KERNEL = "Loading 'nimb_kernel'..."
ROOT_UUID = "root device uuid is '"
KERNEL_START = "kernel: start"

# The children of /efi/configuration-table for the ACPI tables that OVMF has.
ACPI_20_TABLE = "/efi/configuration-table/8868E871-E4F1-11D3-BC22-0080C73C8881"
ACPI_10_TABLE = "/efi/configuration-table/EB9D2D30-2D88-11D3-9A16-0090273FC14D"


def plist(entries, body=""):
    """A property list of string values (`entries`), then `body` as it stands."""
    body = "".join(f"\t<key>{key}</key>\n\t<string>{value}</string>\n" for key, value in entries.items()) + body
    return f'<?xml version="1.0" encoding="UTF-8"?>\n<plist version="1.0">\n<dict>\n{body}</dict>\n</plist>\n'


# --- what the reference kernel reports -------------------------------------------------


@dataclasses.dataclass(frozen=True)
class GuestFile:
    """A file of the reference kernel's build directory (--guest-dir), put on
    the volume in place of content."""

    name: str
    # Zero bytes behind the file up to this size (0: none).
    pad_to: int = 0


def quoted(value):
    """A text as the kernel's report shows it: in double quotes, with \\ and
    \" escaped and bytes outside printable ASCII as \\xNN."""
    out = []
    for byte in value.encode("utf-8") if isinstance(value, str) else value:
        char = chr(byte)
        if char in '"\\':
            out.append("\\" + char)
        elif 0x20 <= byte <= 0x7E:
            out.append(char)
        else:
            out.append(f"\\x{byte:02x}")
    return '"' + "".join(out) + '"'


# A tree value that is a NUL-terminated text, as the report prints it.
text = quoted


def ucs2(value):
    """A tree value that is a NUL-terminated UCS-2 text, as the report prints it."""
    return "u" + quoted(value)


@dataclasses.dataclass(frozen=True)
class AtLeast:
    """A number no smaller than `minimum`."""

    minimum: int

    def __call__(self, value):
        return isinstance(value, int) and value >= self.minimum

    def __repr__(self):
        return f">= {self.minimum}"


@dataclasses.dataclass(frozen=True)
class KernelExpect:
    """What the reference kernel's report must hold. Wanted values are
    compared with ==, except a compiled pattern (full match of the text as
    the report prints it) and a callable such as AtLeast (true for the
    value)."""

    # "pass": every check ok and the result line says so; "fail": at least
    # one check failed.
    result: str = "pass"
    # BootArgs field -> value (texts decoded, numbers as numbers).
    bootargs: dict = dataclasses.field(default_factory=dict)
    # Node path -> {property: value as printed}; an empty dict only asks
    # for the node. text() and ucs2() print values as the kernel does.
    tree: dict = dataclasses.field(default_factory=dict)
    # Range of /chosen/memory-map (its name, or a compiled pattern that one
    # name must match) -> its length, or None for any.
    ranges: dict = dataclasses.field(default_factory=dict)
    # Where the drivers came from: "loader" (staged or a package), "cache"
    # (prelinked in a kernel cache) or "none"; None: not checked.
    drivers_from: str | None = None
    # The driver blocks, in order: identifier -> DriverExpect; None: not
    # checked.
    drivers: dict | None = None
    # The driver package's bytes (its x86 slice), as content; None: not
    # checked.
    package: object = None


@dataclasses.dataclass(frozen=True)
class DriverExpect:
    """A driver block as the kernel must find it: the text of the bundle's
    Info.plist and the code (its x86 slice), as content (bytes, text, a host
    Path or a GuestFile)."""

    plist: object
    code: object = b""


@dataclasses.dataclass(frozen=True)
class ScreenExpect:
    """A screenshot, taken once a line of the serial log holds `when`, and
    what it must show: the background colour in the corner and the
    loader's artwork `picture` ("logo", "failure"; None: any picture) at the
    place of a centred 128 x 128 picture, and, when `alone`, nothing else."""

    when: str
    picture: str | None = None
    background: tuple = (191, 191, 191)
    # False: whatever else is on the screen is printed, but doesn't fail the
    # scenario.
    alone: bool = True
    # The spinner below the logo: "turning" (a frame of it in this shot and
    # another frame in a second shot a moment later), "gone" (its square is
    # background) or None (not looked at).
    spinner: str | None = None


def kernel_file(name="nimb_kernel"):
    """The volume's files for a boot of the reference kernel."""
    return {"nimb_kernel": GuestFile(name)}


def test_picture(width, height):
    """A binary PPM picture: colour bands, a gradient and a dark box in the
    middle, so that the blurred grey has edges to show."""
    rows = []
    for y in range(height):
        blocks = ((x * 255 // width, y * 255 // height, 255 - x * 255 // width) for x in range(0, width, 8))
        row = b"".join(bytes(block) * 8 for block in blocks)[: 3 * width]
        if height // 3 <= y < 2 * height // 3:
            box = width // 4
            row = row[: 3 * box] + bytes((20, 30, 40)) * (width - 2 * box) + row[3 * (width - box) :]
        rows.append(row)
    return f"P6\n{width} {height}\n255\n".encode() + b"".join(rows)


@dataclasses.dataclass(frozen=True)
class ResumeImage:
    """A resume image on a raw partition, written by tools/mkresume with the
    restart probe of tests/guest/ as its restart code; the NVRAM settings
    that ask for it go into platform.cfg (a scenario's own keys win)."""

    # mkresume's options beyond the partition's.
    args: tuple = ()
    # A function that gives the preview picture as PPM bytes, or None.
    preview: object = None
    partition_bytes: int = 8 << 20


@dataclasses.dataclass(frozen=True)
class ResumeReads:
    """The loader's DiskIO reads before a reset, as the platform logs them:
    the header first, then at most `after_header` reads (None: any), each
    inside the `first_stage` bytes behind a page-aligned header."""

    after_header: int | None = 0
    first_stage: int = 1 << 20


# --- the extensions directory ------------------------------------------------------------

EXTENSIONS_DIR = "System/Library/Extensions"


def driver_plist(identifier, required=None, executable=None, libraries=()):
    """A driver bundle's Info.plist: its identifier, and the keys that the
    loader reads when given (`required` a string, or another tag's text)."""
    keys = {"VzBundleIdentifier": identifier, **({"VzBundleExecutable": executable} if executable is not None else {})}
    body = ""
    if required is not None:
        tag = required if required.startswith("<") else f"<string>{required}</string>"
        body += f"\t<key>VzBundleRequired</key>\n\t{tag}\n"
    if libraries:
        entries = "".join(f"\t\t<key>{name}</key>\n\t\t<string>1.0</string>\n" for name in libraries)
        body += f"\t<key>VzBundleLibraries</key>\n\t<dict>\n{entries}\t</dict>\n"
    return plist(keys, body)


def driver_code(seed, length):
    """A small driver's code: bytes that differ from bundle to bundle."""
    return bytes((seed * 131 + i * 7 + (i >> 5)) & 0xFF for i in range(length))


def standard_extensions():
    """The extensions directory that every volume carries unless its scenario
    says otherwise: a flat bundle with code, a full-layout bundle whose code
    is a fat file (tests/guest's driver.fat, whose x86 slice is the file
    nimb_kernel) with a nested bundle that has no code, and a "Safe Boot"
    bundle that the loader leaves out."""
    root = EXTENSIONS_DIR
    return {
        f"{root}/Console.drvb/Info.plist": driver_plist("com.quill.driver.Console", "Root", "Console"),
        f"{root}/Console.drvb/Console": driver_code(1, 1001),
        f"{root}/Storage.drvb/Contents/Info.plist": driver_plist(
            "com.quill.driver.Storage", "Local-Root", "Storage", libraries=("com.quill.driver.Console",)
        ),
        f"{root}/Storage.drvb/Contents/Tarnix/Storage": GuestFile("driver.fat"),
        f"{root}/Storage.drvb/Contents/PlugIns/Partition.drvb/Info.plist": driver_plist(
            "com.quill.driver.Partition", ""
        ),
        f"{root}/Network.drvb/Info.plist": driver_plist("com.quill.driver.Network", "Safe Boot", "Network"),
        f"{root}/Network.drvb/Network": driver_code(3, 64),
    }


def standard_drivers():
    """The driver blocks that the standard extensions give, in the order of
    discovery: each kept bundle, its nested ones right behind it; the
    "Safe Boot" bundle is left out, in safe mode too."""
    files = standard_extensions()
    root = EXTENSIONS_DIR
    return {
        "com.quill.driver.Console": DriverExpect(files[f"{root}/Console.drvb/Info.plist"],
                                                 files[f"{root}/Console.drvb/Console"]),
        "com.quill.driver.Storage": DriverExpect(files[f"{root}/Storage.drvb/Contents/Info.plist"],
                                                 GuestFile("nimb_kernel")),
        "com.quill.driver.Partition": DriverExpect(
            files[f"{root}/Storage.drvb/Contents/PlugIns/Partition.drvb/Info.plist"]),
    }  # fmt: skip


# The default driver package of a disk boot, and a fat one to put there: the
# kernel must get its x86 slice, which is the file nimb_kernel.
DRIVER_PACKAGE = "System/Library/Extensions.drvpk"
PACKAGE_FILE = GuestFile("driver.fat")
PACKAGE_SLICE = GuestFile("nimb_kernel")


@dataclasses.dataclass(frozen=True)
class KernelCache:
    """A kernel cache that kcache writes on the volume for the harness's
    machine, timed one second after the newer of the kernel and the
    extensions, plus `shift` seconds. "volume:" arguments are volume paths."""

    args: tuple = ()
    kernel: str = "nimb_kernel"
    model: str = "QEMU1,1"
    shift: float = 0
    # Breaks the header's checksum, so that the cache decompresses but fails.
    break_checksum: bool = False
    # Whether the loader is to look for it (and print its name): not in
    # safe mode, nor with a package that the user named.
    looked_for: bool = True


@dataclasses.dataclass(frozen=True)
class Scenario:
    name: str
    # platform.cfg keys, over BASE_CONFIG; the file is left out when there
    # are none.
    config: dict = dataclasses.field(default_factory=dict)
    # Whether BASE_CONFIG goes in front of `config`.
    base_config: bool = True
    # Extra files of the ESP: path with '/' -> bytes, text, a host Path or
    # a GuestFile.
    files: dict = dataclasses.field(default_factory=dict)
    # The extensions directory's files (paths as in `files`), put on the
    # volume with the others; None: no extensions directory at all.
    extensions: dict | None = dataclasses.field(default_factory=standard_extensions)
    directories: tuple = ()
    # A kernel cache made for the volume, or None.
    cache: KernelCache | None = None
    # The disk's size in MiB.
    disk_mib: int = 64
    # Exact modification times (UTC, "YYYY-MM-DD hh:mm:ss.nnnnnnnnn") of
    # files or directories of the volume, as the platform layer serves them.
    times: dict = dataclasses.field(default_factory=dict)
    # Texts that must appear in the serial log, in this order.
    expect: tuple = ()
    # Texts that must not appear.
    forbid: tuple = ()
    # The console modes that the loader asks for ("text", "graphics"), all of
    # them in their order; None: not checked.
    console_modes: tuple | None = None
    # The loader's status as the platform reports it ("other": any but
    # EFI_ABORTED and EFI_SUCCESS), and whether free memory came back.
    status: str = "EFI_ABORTED"
    memory: str = "same"
    # The exit name (kExit... of platform/exitcodes.h or of the kernel's
    # tests/guest/exitcodes.h, without kExit) when the run is to end other
    # than by the loader's coming back; overrides status and memory.
    exit: str | None = None
    # The reference kernel's report, when the loader is to start it.
    kernel: KernelExpect | None = None
    # A screenshot and what it must show.
    screen: ScreenExpect | None = None
    timeout: float = 90.0
    # A network boot: no disk; the files (platform.cfg, the loader
    # nimbboot.efi and the others, by their paths on the server) are served
    # over QEMU's TFTP, and the firmware's PXE starts the platform layer as
    # the boot file. Needs a build of the platform with the network.
    network: bool = False
    # What the harness does to the running machine when a line of the serial
    # log holds a text: (text, action) pairs, each done once. Actions:
    # ("link-off",) takes the NIC's link down; ("truncate", path, size) cuts a
    # served file.
    actions: tuple = ()
    # Check the kernel's network identity and DHCP answer against the
    # packets captured on the wire.
    capture: bool = False
    # A resume image on a second partition, and the NVRAM settings for it.
    resume: ResumeImage | None = None
    # The starts of the machine on one variable store: above 1, a reset
    # starts it again, and the run must end in exactly this many.
    boots: int = 1
    # The loader's reads up to a reset.
    reads: ResumeReads | None = None
    # platform.cfg keys (over BASE_CONFIG) of an earlier power-on of the same
    # volume on the same variable store: its log comes in front of the
    # scenario's own for `expect` and `forbid`; the report and exit are the
    # scenario's run's. None: no earlier power-on.
    before_config: dict | None = None
    # The disk is a stick image (mkdisk --stick, its platform.cfg unless the
    # scenario has one) on a USB controller.
    usb: bool = False
    # QEMU's arguments beyond the harness's machine (tools/qemuboot).
    qemu_args: tuple = ()
    # A machine without serial port and debug-exit device, as a PC: only
    # the screen tells the outcome.
    bare: bool = False
    # Lines that the firmware's text console must show (found in screenshots
    # taken twice a second); then Enter is pressed, and `after_key` must
    # replace them. The run ends as "Stopped".
    screen_text: tuple = ()
    after_key: str = ""
    # The harness stops the machine once a line of the serial log holds this
    # text: the run ends as "Stopped".
    stop_at: str = ""
    # Keys held down on the machine's keyboard from power-on (QEMU key
    # codes: "shift", "meta_l", "v", ...), never let go: QMP sends their
    # key-down events as the machine starts, and again every 50 ms from the
    # firmware's boot manager on until the platform has read the keyboard
    # (not earlier: with key events streaming in while OVMF started, its
    # PS/2 keyboard driver saw neither of two held keys), as a real keyboard
    # repeats a held key (the firmware's keyboard driver resets the keyboard
    # and forgets what was down before). The PS/2 keyboard of the machine,
    # or with `usb_keyboard` a USB one.
    held: tuple = ()
    usb_keyboard: bool = False


def fatal(name, *messages, before=(), make=Scenario, **knobs):
    """A boot that the loader gives up: the platform's lines `before`, then
    `messages`, then the loader back with EFI_ABORTED and the firmware's free
    memory as it was before the start (the Scenario's defaults)."""
    return make(name, expect=(*before, "platform: starting", *messages, "platform: loader returned"), **knobs)


# A driver whose code is a fat file that declares an x86 slice of 3.75 GiB:
# no machine of the harness has the pages for it.
HUGE_DRIVER = {
    f"{EXTENSIONS_DIR}/Huge.drvb/Info.plist": driver_plist("com.quill.driver.Huge", "Root", "Huge"),
    f"{EXTENSIONS_DIR}/Huge.drvb/Huge": struct.pack(">7I", 0xCAFEBABE, 1, 7, 3, 28, 0xF0000000, 12),
}

def low_kernel(room):
    """A kernel object of one page of code that leaves `room` pages below
    the legacy video hole at 640 KiB, never memory: the boot record (a page),
    colour table (one), failure picture (five), device tree (one), memory map
    and runtime area that follow it run into the hole in turn."""
    address = 0xA0000 - (room + 1) * 0x1000

    def command(kind, length, words):
        return (struct.pack("<II", kind, length) + struct.pack(f"<{len(words)}I", *words)).ljust(length, b"\0")

    entry = [0] * 10 + [address] + [0] * 5  # the thread's registers, the instruction pointer eleventh
    body = command(1, 56, [0, 0, 0, 0, address, 0x1000, 0x1000, 16, 7, 7]) + command(5, 80, [1, 16, *entry])
    return (struct.pack("<7I", 0xFEEDFACE, 7, 3, 2, 2, len(body), 0) + body).ljust(0x1000, b"\0") + bytes(16)


_TABLE = [
    # The loader's fatal messages that the firmware reaches with a shaped
    # volume or configuration, each with all memory given back.
    fatal("no_kernel", KERNEL_ERROR, forbid=("WARNING: all of R,P,S exist",)),
    fatal("kernel_not_loadable", "bad magic number 0x3020100", KERNEL_ERROR,
          files={"nimb_kernel": bytes(range(256)) * 16}),
    fatal("drivers_missing", LOADING_KERNEL, "Loading drivers...", "Error loading drivers", files=kernel_file(),
          extensions=None),
    fatal("driver_too_large", "Loading drivers...", "Could not allocate driver module memory", files=kernel_file(),
          extensions=HUGE_DRIVER),
    # A kernel placed so low that what comes behind it finds no memory.
    *(fatal(name, message, files={"nimb_kernel": low_kernel(room)}, extensions=None, directories=(EXTENSIONS_DIR,))
      for name, room, message in [
          ("no_room_boot_record", 0, "Couldn't allocate bootArgs"),
          ("no_room_colour_table", 1, "Could not allocate CLUT"),
          ("no_room_failure_picture", 2, "Could not allocate Pict-FailedBoot"),
          ("no_room_device_tree", 7, "Couldn't allocate device tree"),
          ("no_room_memory_map", 8, "Couldn't allocate memory map"),
          ("no_room_runtime_area", 127, "Runtime services area not free"),
      ]),
    # The firmware's own console, without the console control that the
    # platform otherwise adds.
    fatal("console_missing", "Can not initialize console", config={"console": "none"},
          forbid=("platform: console mode",)),
    # Options that reach the loader, shown by the kernel they name. Also the
    # platform without its configuration file.
    fatal("rps_all", "WARNING: all of R,P,S exist: booting from 'R'", KERNEL_ERROR,
          before=("platform: no platform.cfg, defaults used",), base_config=False,
          directories=("com.quill.boot.R", "com.quill.boot.P", "com.quill.boot.S")),
    # Text mode and load options with blanks ahead that the loader drops.
    fatal("text_console", "console text", "Error loading kernel 'nimb_test'",
          config={"console": "text", "options": "  Kernel=nimb_test -v"}, forbid=(KERNEL_ERROR,)),
    # Shift held alone: safe mode, which reads no NVRAM (the kernel that
    # boot-args names would win over the configuration file's). The Shift of
    # keys= wins over GUI-V held on the keyboard.
    fatal("safe_mode_keys", "Using Safe Mode", "Error loading kernel 'mach_test'",
          before=("platform: keys: modifiers 0x2, 0 keys, ignored 0, from platform.cfg",
                  "platform: nvram boot-args set"),
          config={"keys": "shift", "nvram.boot-args": "Kernel=nvram_kernel"}, held=("meta_l", "v"),
          files={BOOT_PLIST: plist({"Kernel": "mach_test"})}, forbid=("nvram_kernel", KERNEL_ERROR)),
    # GUI-V held: a verbose boot switches a graphics console to text before
    # anything else, and back to graphics only on the way out.
    fatal("verbose_text", "platform: console mode text", KERNEL_ERROR, "platform: console mode graphics",
          config={"keys": "gui+v", "console": "graphics"}, console_modes=("text", "graphics")),
    # boot-args names the kernel; Shift is held, but the boot policy says
    # that held keys are not to be read: no safe mode to skip NVRAM.
    fatal("nvram_args", "Error loading kernel 'from_nvram'",
          before=("platform: keys: modifiers 0x2, 0 keys, ignored 1", "platform: nvram boot-args set for good, 17 bytes"),
          config={"nvram.boot-args": "Kernel=from_nvram", "keys": "shift", "keys-ignored": "1"},
          forbid=("Using Safe Mode", KERNEL_ERROR)),
    # Keys held on the machine's own keyboard from power-on, read by the
    # platform (no keys= in platform.cfg): Shift alone is safe mode, -x for
    # the kernel; GUI-V a verbose boot, on the PS/2 keyboard and a USB one.
    Scenario("keys_held_shift", held=("shift",), files=kernel_file(), exit="KernelPass",
             expect=("platform: keys: modifiers 0x2, 0 keys, ignored 0, from keyboard", "Using Safe Mode",
                     KERNEL_START),
             kernel=KernelExpect(bootargs={"commandLine": "-x"})),
    *(Scenario(name, held=("meta_l", "v"), usb_keyboard=usb, config={"console": "graphics"}, files=kernel_file(),
               expect=("platform: keys: modifiers 0x8, 1 keys, ignored 0, from keyboard", KERNEL_START),
               console_modes=("text",), exit="KernelPass",
               kernel=KernelExpect(bootargs={"commandLine": "-v", "videoDisplayMode": 2}))
      for name, usb in [("keys_held_gui_v", False), ("keys_held_gui_v_usb", True)]),
    # The platform's own way out: an unknown key is reported and ignored, and
    # a loader that isn't there ends the run before anything starts.
    Scenario(
        "platform_no_loader",
        base_config=False,
        config={"colour": "blue", "loader": "\\EFI\\BOOT\\missing.efi"},
        expect=(
            "platform: platform.cfg line 1: unknown key 'colour' ignored",
            "platform: error: loader \\EFI\\BOOT\\missing.efi not found (EFI_NOT_FOUND)",
            # The same on the firmware's console, which OVMF mirrors to the port.
            "Platform error: loader \\EFI\\BOOT\\missing.efi not found (EFI_NOT_FOUND)",
        ),
        forbid=("platform: starting",),
        exit="LoaderMissing",
    ),
    # A plain graphics boot of the reference kernel from the volume's root,
    # with what every boot hands over. The boot device path that the disk
    # tool computes for kernel caches is the one the firmware gives.
    Scenario(
        "kernel_plain",
        config={"console": "graphics", "options": "foo=1"},
        files=kernel_file(),
        expect=(
            f"platform: boot device path {mkdisk.boot_device_path().hex()}\n",
            LOADING_KERNEL,
            f"{ROOT_UUID}{PARTITION_GUID}'",
            KERNEL_START,
        ),
        forbid=("platform: loader returned",),
        exit="KernelPass",
        kernel=KernelExpect(
            bootargs={"commandLine": "foo=1", "videoDisplayMode": 1, "videoWidth": AtLeast(640),
                      "runtimePageCount": AtLeast(2)},
            tree={
                "/chosen": {"boot-file": text("nimb_kernel"), "boot-args": text("foo=1"),
                            "boot-uuid": text(PARTITION_GUID)},
                "/chosen/memory-map": {},
                "/efi": {"firmware-abi": text("EFI64")},
                "/efi/platform": {"Model": ucs2("QEMU1,1"), "BusFrequency": "<00 e1 f5 05 00 00 00 00> (0x5f5e100)"},
                "/efi/runtime-services": {},
                ACPI_20_TABLE: {"alias": text("ACPI_20")},
                ACPI_10_TABLE: {"alias": text("ACPI")},
            },
            ranges={"BootCLUT": 0x300, "Pict-FailedBoot": 0x4020},
        ),
    ),  # fmt: skip
    # Without debug-exit the platform goes back to the firmware with an
    # error, which the firmware's boot manager reports before its next
    # option, with the file system as it was.
    Scenario(
        "platform_back_to_firmware",
        config={"debug-exit": "0", "loader": "\\EFI\\BOOT\\missing.efi"},
        expect=("platform: debug-exit not used", "platform: exit code 0x21",
                "back to the firmware with EFI_LOAD_ERROR", "failed to start Boot0002", ": Load Error", "FS0:"),
        stop_at="FS0:",
        exit="Stopped",
    ),
    # A firmware without graphics output: the loader finds a text console,
    # is refused the graphics it asks for and boots the kernel in text.
    Scenario(
        "kernel_no_graphics",
        config={"console": "graphics"},
        files=kernel_file(),
        qemu_args=("-vga", "none"),
        expect=("platform: no graphics output: console text", "platform: starting \\EFI\\BOOT\\nimbboot.efi, console text",
                "platform: console mode graphics refused (EFI_UNSUPPORTED)", LOADING_KERNEL, KERNEL_START),
        console_modes=("graphics",),
        exit="KernelPass",
        kernel=KernelExpect(bootargs={"videoDisplayMode": 2}),
    ),
    # A PC without serial port and debug-exit device: the outcome and the
    # request for a key on the screen, then the firmware's own shell once
    # the platform went back to it.
    Scenario(
        "screen_outcome_bare",
        config={"wait-key": "1"},
        bare=True,
        screen_text=("The loader returned EFI_ABORTED (0x8000000000000015).", "Press a key to go on."),
        after_key="Shell>",
        exit="Stopped",
        timeout=150.0,
    ),
    # -v: the console goes to text and stays there for the kernel.
    Scenario(
        "kernel_verbose",
        config={"console": "graphics", "options": "-v"},
        files=kernel_file(),
        expect=(LOADING_KERNEL, KERNEL_START),
        console_modes=("text",),
        exit="KernelPass",
        kernel=KernelExpect(bootargs={"commandLine": "-v", "videoDisplayMode": 2}),
    ),
    # The command line merged from load options, boot-args and the
    # configuration file's Kernel Flags (the first to name a key wins), and
    # the configuration file's Root UUID in place of the volume's.
    Scenario(
        "kernel_config",
        config={"options": "foo=1", "nvram.boot-args": "foo=2 bar=3"},
        files={**kernel_file(), BOOT_PLIST: plist({"Kernel Flags": "baz=4 bar=5", "Root UUID": "not-a-uuid"})},
        expect=(LOADING_KERNEL, f"{ROOT_UUID}not-a-uuid'", KERNEL_START),
        forbid=(PARTITION_GUID,),
        exit="KernelPass",
        kernel=KernelExpect(
            bootargs={"commandLine": "foo=1 bar=3 baz=4"},
            tree={"/chosen": {"boot-uuid": text("not-a-uuid"), "boot-args": text("foo=1 bar=3 baz=4")}},
        ),
    ),
    # What the platform hands over for the kernel: a device properties blob
    # larger than the loader's first buffer (so it asks twice) and the two
    # network answers, all of which reach the tree.
    Scenario(
        "kernel_devices",
        config={
            "options": "foo=1",
            "device-properties-hex": bytes(i * 7 % 256 for i in range(5000)).hex(),
            "netboot.dhcp-hex": bytes(range(200)).hex(),
            "netboot.bsdp-hex": "0102030405",
        },
        files=kernel_file(),
        expect=("platform: device properties asked with 4096 bytes: EFI_BUFFER_TOO_SMALL, 5000 bytes",
                KERNEL_START),
        exit="KernelPass",
        kernel=KernelExpect(
            tree={
                "/efi": {"device-properties": re.compile(r"<00 07 0e 15 .*\.\.\.> \(5000 bytes\)")},
                "/chosen": {"dhcp-response": re.compile(r"<00 01 02 03 .*\.\.\.> \(200 bytes\)"),
                            "svcd-response": "<01 02 03 04 05>"},
            },
        ),
    ),  # fmt: skip
    # The boot screen as the kernel finds it: the logo alone in the middle
    # of the grey screen (the platform keeps the loader's text off it).
    Scenario(
        "screen_logo",
        config={"console": "graphics", "options": "guest.hold=3"},
        files=kernel_file(),
        exit="KernelPass",
        kernel=KernelExpect(bootargs={"videoDisplayMode": 1}),
        screen=ScreenExpect(when="kernel: hold", picture="logo", alone=True),
    ),
    # A failed graphics boot ends on the failure picture, taken while the
    # platform holds the machine after the loader came back.
    fatal("screen_failure", KERNEL_ERROR, config={"console": "graphics", "hold": 2},
          screen=ScreenExpect(when="platform: memory", picture="failure")),
]
# The kernel as fat files, either byte order, under the default name.
_TABLE += [
    Scenario(f"kernel_fat_{order}", files=kernel_file(f"nimb_kernel.fat-{order}"),
             expect=(LOADING_KERNEL, KERNEL_START), exit="KernelPass",
             kernel=KernelExpect(tree={"/chosen": {"boot-file": text("nimb_kernel")}}))
    for order in ("be", "le")
]  # fmt: skip

# --- network boots ----------------------------------------------------------------------

# The loader's defaults on a network boot: the kernel next to the loader and
# its package behind it.
NET_KERNEL = "nimb.tarnix"
NET_PACKAGE = "nimb.tarnix.drvpk"
# A driver package: the loader copies it as it stands (it isn't fat).
NET_PACKAGE_BYTES = bytes(i * 13 % 251 for i in range(20000))


def net_kernel_files(name="nimb_kernel", pad_to=0, package=True):
    """The served kernel under its default name, with its package."""
    files = {NET_KERNEL: GuestFile(name, pad_to)}
    if package:
        files[NET_PACKAGE] = NET_PACKAGE_BYTES
    return files


# The package's range in /chosen/memory-map, named by its address.
PACKAGE_RANGE = re.compile(r"DriversPackage-[0-9a-f]+")
# A kernel file as large as a real one, which takes a while to come.
BIG_KERNEL = 16 << 20


def net_file_path(name):
    """A device path over the network device, as NVRAM holds the kernel's
    path: PciRoot(0)/Pci(2,0)/MAC(NET_MAC,1)/File(name)/End, in bytes."""
    mac = bytes.fromhex(NET_MAC.replace(":", "")).ljust(32, b"\0")
    text = (name + "\0").encode("utf-16-le")
    return b"".join((
        bytes([2, 1, 12, 0]) + struct.pack("<II", 0x0A0341D0, 0),
        bytes([1, 1, 6, 0, 0, 2]),
        bytes([3, 11, 37, 0]) + mac + bytes([1]),
        bytes([4, 4]) + struct.pack("<H", 4 + len(text)) + text,
        bytes([0x7F, 0xFF, 4, 0]),
    ))


# A network boot: nothing but the served files (no extensions directory).
NetScenario = functools.partial(Scenario, network=True, extensions=None, timeout=150.0)
READING_BIG = f"net read of {NET_KERNEL} into"

_TABLE += [
    # The firmware's PXE starts the platform, which serves the loader's files
    # from the same TFTP server: the reference kernel boots with the network's
    # identity and the server's real answers in its tree.
    NetScenario(
        "net_kernel",
        config={"options": "foo=1 guest.hold=1"},
        files=net_kernel_files(),
        expect=(
            "platform: net boot: station",
            "platform: net read of nimbboot.efi",
            f"platform: net read of {NET_PACKAGE} into",
            KERNEL_START,
        ),
        exit="KernelPass",
        kernel=KernelExpect(
            bootargs={"commandLine": "foo=1 guest.hold=1"},
            tree={"/": {"net-boot": "<>"}, "/chosen": {"boot-file": text(NET_KERNEL)}},
            ranges={PACKAGE_RANGE: len(NET_PACKAGE_BYTES)},
        ),
        capture=True,
        # The spinner is wiped before the hand-off: the logo stands alone.
        screen=ScreenExpect(when="kernel: hold", picture="logo", alone=True, spinner="gone"),
    ),
    # The spinner turns below the logo while a large kernel comes over the
    # network.
    NetScenario(
        "net_spinner",
        files=net_kernel_files(pad_to=BIG_KERNEL),
        expect=(f"platform: {READING_BIG} {BIG_KERNEL} bytes: EFI_SUCCESS", KERNEL_START),
        exit="KernelPass",
        screen=ScreenExpect(when=READING_BIG, picture="logo", alone=False, spinner="turning"),
        timeout=200.0,
    ),
    # efi-boot-file-data names another kernel on the server, and the
    # configuration file comes from the server too.
    NetScenario(
        "net_other_kernel",
        config={"nvram-hex.efi-boot-file-data": net_file_path("kernels\\other_kernel").hex()},
        files={
            "kernels/other_kernel": GuestFile("nimb_kernel.fat-le"),
            "kernels/other_kernel.drvpk": NET_PACKAGE_BYTES,
            "com.quill.Boot.plist": plist({"Kernel Flags": "from_server=1"}),
        },
        expect=("platform: net read of com.quill.Boot.plist into", "platform: net read of kernels/other_kernel into",
                KERNEL_START),
        forbid=(f"of {NET_KERNEL}",),
        exit="KernelPass",
        kernel=KernelExpect(bootargs={"commandLine": "from_server=1"}),
    ),
    # The network's fatal messages. A network boot has no driver bundles to
    # fall back on: without its package the boot ends.
    fatal("net_no_package", f"platform: net size of {NET_PACKAGE}: EFI_NOT_FOUND", "Error loading drivers",
          make=NetScenario, files=net_kernel_files(package=False)),
    # The kernel cut short on the server while it comes, ...
    fatal("net_size_mismatch", READING_BIG, "Network file size mismatch", make=NetScenario,
          files=net_kernel_files(pad_to=BIG_KERNEL), actions=((READING_BIG, ("truncate", NET_KERNEL, 1 << 20)),),
          timeout=200.0),
    # ... a server that stops answering in the middle of the kernel (the
    # firmware's TFTP gives up), ...
    fatal("net_server_gone", READING_BIG, f"Error loading kernel '{NET_KERNEL}'", make=NetScenario,
          files=net_kernel_files(pad_to=BIG_KERNEL), actions=((READING_BIG, ("link-off",)),), timeout=300.0),
    # ... and a kernel whose name no TFTP request can carry.
    fatal("net_long_name", "platform: net request of a path of no TFTP name: EFI_INVALID_PARAMETER",
          f"Error loading kernel '{NET_KERNEL}'", make=NetScenario,
          config={"nvram-hex.efi-boot-file-data": net_file_path("k" * 500).hex()}),
]  # fmt: skip

# --- hibernation resume -----------------------------------------------------------------

RESUME_OFFSET = 0x10000  # mkresume's default header offset
RESET = "platform: reset type 0 status 0x0"
STAGE = 1 << 20


def nvram_at_start(signature, image, key):
    """The platform's line of the resume variables at a start."""
    return f"platform: nvram at start: boot-signature={signature} boot-image={image} boot-image-key={key}"


# boot-image: hard-drive node, file-path node of the offset's text, end node.
ACCEPTED_THEN_RESET = nvram_at_start("absent", 42 + 4 + 2 * (len(f"{RESUME_OFFSET:x}") + 1) + 4, "absent")


def resumed(name, args, preview=None, screen=None):
    """The image restarts: the probe's checks all pass, and the machine never
    resets."""
    return Scenario(
        name,
        resume=ResumeImage(args=args, preview=preview),
        expect=("platform: boot 1", "platform: starting", KERNEL_START, "kernel: result pass"),
        forbid=(RESET, "platform: boot 2", "platform: loader returned"),
        exit="KernelPass",
        kernel=KernelExpect(),
        screen=screen,
        timeout=150.0,
    )


def reset_then_boot(name, args, after=ACCEPTED_THEN_RESET, reads=ResumeReads(), config=None):
    """The loader resets the machine without a restart; the second start,
    on the same variable store, finds NVRAM as `after` says and boots the
    reference kernel."""
    return Scenario(
        name,
        config=config or {},
        resume=ResumeImage(args=args),
        files=kernel_file(),
        boots=2,
        expect=("platform: boot 1", "platform: starting", RESET, "platform: boot 2", after, LOADING_KERNEL,
                KERNEL_START),
        forbid=("platform: loader returned",),
        exit="KernelPass",
        kernel=KernelExpect(),
        reads=reads,
        timeout=180.0,
    )


_TABLE += [
    # Each key size; the bar stops where the first stage ends in a larger
    # image; the offset text with and without 0x; nothing encrypted.
    resumed("resume_aes128", ("--key-bytes", "16", "--image-bytes", "3M", "--hex-prefix")),
    resumed("resume_aes192", ("--key-bytes", "24", "--image-bytes", "2M", "--seed", "2")),
    resumed("resume_plain", ("--image-bytes", "4M", "--seed", "5")),
    # With the preview: the screenshot shows it blurred in grey under the bar.
    resumed("resume_aes256_preview", ("--key-bytes", "32", "--image-bytes", "8M", "--first-stage", "6M", "--seed", "3"),
            preview=lambda: test_picture(1280, 800),
            screen=ScreenExpect(when="kernel: resume header=", picture=None, background=None, alone=False)),
    # A preview of another size: the logo under the bar.
    resumed("resume_preview_wrong_size", ("--key-bytes", "32", "--first-stage", "2M", "--seed", "4"),
            preview=lambda: test_picture(640, 480),
            screen=ScreenExpect(when="kernel: resume header=", picture="logo", alone=False)),
    # Refused images, and headers that break a limit (nothing is read behind
    # the header): a reset, and a normal boot on the next start.
    *(reset_then_boot(name, args) for name, args in [
        ("resume_bad_magic", ("--key-bytes", "16", "--set", "magic=0x73696D66")),
        ("resume_wrong_machine", ("--key-bytes", "16", "--machine-signature", "0x5A5A")),
        ("resume_limit_first_stage", ("--set", "firstStageBytes=256")),
        ("resume_limit_preview_stage", ("--set", "previewBytes=0x200000")),
        ("resume_limit_image_bytes", ("--set", "imageBytes=0x80000")),
        ("resume_limit_encrypted_end", ("--key-bytes", "16", "--set", f"encryptedOffset={STAGE}")),
        ("resume_limit_encrypted_step", ("--key-bytes", "16", "--set", f"encryptedOffset={STAGE - 0x1008}")),
        ("resume_limit_first_extent", ("--set-extent", f"0:{RESUME_OFFSET:#x}:256")),
        ("resume_limit_no_key", ("--key-bytes", "16", "--no-key-variable")),
    ]),
    reset_then_boot("resume_no_boot_image", ("--key-bytes", "16", "--no-boot-image"),
                    nvram_at_start("absent", "absent", "16"), reads=None),
    # The list holds fewer extents than the first stage needs: reads may
    # begin, but none leaves the first stage.
    reset_then_boot("resume_limit_extent_list", ("--extent-bytes-field", "32"),
                    reads=ResumeReads(after_header=None, first_stage=STAGE)),
    reset_then_boot("resume_limit_key_length", ("--key-bytes", "16"),
                    config={"nvram-hex.boot-image-key": "00112233445566778899aabbccddeeff0011223344"}),
]  # fmt: skip


# NVRAM hygiene. Each configured variable is reported as a start finds it.
def nvram_lines(name, found, action):
    return f"platform: nvram {name} at start: {found}", f"platform: nvram {name} {action}"


_TABLE += [
    # A variable for this boot only is gone on the next start of the run
    # (the loader resets the machine on an image it refuses), and set again;
    # one set for good is there and left alone.
    dataclasses.replace(
        reset_then_boot("nvram_volatile", ("--key-bytes", "16", "--set", "magic=0x73696D66"),
                        config={"nvram-volatile.guest-volatile": "v", "nvram.guest-kept": "k"}),
        expect=("platform: boot 1", *nvram_lines("guest-volatile", "absent", "set for this boot, 1 bytes"),
                *nvram_lines("guest-kept", "absent", "set for good, 1 bytes"), "platform: starting", RESET,
                "platform: boot 2", ACCEPTED_THEN_RESET, *nvram_lines("guest-volatile", "absent", "set for this boot"),
                *nvram_lines("guest-kept", "1 bytes", "left as the first start made it"), LOADING_KERNEL,
                KERNEL_START)),
    # A variable that an earlier power-on set for good is deleted, and the
    # loader no longer boots the kernel it named; one not there is no error.
    fatal("nvram_delete", KERNEL_ERROR,
          before=("platform: nvram boot-args set for good, 17 bytes", "Error loading kernel 'from_nvram'",
                  "platform: loader returned", "platform: boot 1", *nvram_lines("boot-args", "17 bytes", "deleted"),
                  *nvram_lines("guest-never", "absent", "not there to delete")),
          before_config={"nvram.boot-args": "Kernel=from_nvram"},
          config={"nvram-delete.boot-args": "", "nvram-delete.guest-never": ""}),
    # The stick image, with its own platform.cfg for a real PC, boots from
    # a USB controller (its device path: a USB node, then the partition's)
    # to the reference kernel.
    Scenario("usb_stick", base_config=False, files=kernel_file(), usb=True,
             expect=("03050600000004012a00", LOADING_KERNEL, KERNEL_START), forbid=("unknown key",),
             exit="KernelPass", kernel=KernelExpect(), timeout=150.0),
]  # fmt: skip


# Kernel caches and drivers. Times are UTC; the platform serves them to the
# loader exactly, nanoseconds included.
DRIVERS_STAGED = KernelExpect(drivers_from="loader", drivers=standard_drivers())
PACKAGE_SLICE_ONLY = KernelExpect(drivers_from="loader", drivers={}, package=PACKAGE_SLICE)
FROM_BUNDLES = (LOADING_KERNEL, "Loading drivers...", KERNEL_START)
CACHE = KernelCache(args=("--drivers", f"volume:{EXTENSIONS_DIR}"))
CACHE_NOT_LOOKED_FOR = dataclasses.replace(CACHE, looked_for=False)
EXTENSIONS_TIME = {EXTENSIONS_DIR: "2010-06-30 23:59:59.250000000"}
WITH_PACKAGE = {**kernel_file(), DRIVER_PACKAGE: PACKAGE_FILE}


def drivers(name, kernel=DRIVERS_STAGED, expect=FROM_BUNDLES, files=kernel_file(), **knobs):
    """A boot of the reference kernel with drivers as `kernel` says."""
    return Scenario(name, files=files, expect=expect, exit="KernelPass", kernel=kernel, **knobs)


_TABLE += [
    # A plain boot stages the bundles: libraries, a nested bundle, a fat
    # code file, and a "Safe Boot" bundle left out.
    drivers("drivers_bundles"),
    # A cache exactly one second after the kernel, across a year boundary,
    # with the bundles prelinked: no drivers are loaded.
    drivers("cache_hit", KernelExpect(drivers_from="cache", drivers=standard_drivers()), (KERNEL_START,),
            times={"nimb_kernel": "2006-12-31 23:59:59.500000000", EXTENSIONS_DIR: "2006-12-31 23:59:58.000000000"},
            cache=CACHE, forbid=("Loading drivers...", LOADING_KERNEL)),
    # The same cache two seconds off, here the extensions being the newer:
    # the plain kernel and the bundles.
    drivers("cache_two_seconds_off", cache=dataclasses.replace(CACHE, shift=2),
            times={"nimb_kernel": "2009-03-01 10:00:00.000000000", EXTENSIONS_DIR: "2009-03-01 10:00:05.700000000"}),
    # A cache whose checksum is wrong falls back to the plain kernel.
    drivers("cache_bad_checksum", cache=dataclasses.replace(CACHE, break_checksum=True)),
    # The driver package exactly one second after the extensions directory
    # is used; its x86 slice reaches the kernel.
    drivers("package_used", PACKAGE_SLICE_ONLY,
            ("Loading drivers...", "Loading System\\Library\\Extensions.drvpk...", KERNEL_START), WITH_PACKAGE,
            times={**EXTENSIONS_TIME, DRIVER_PACKAGE: "2010-07-01 00:00:00.250000000"}),
    # Two seconds after: stale, the bundles instead.
    drivers("package_stale", files=WITH_PACKAGE, forbid=("Extensions.drvpk...",),
            times={**EXTENSIONS_TIME, DRIVER_PACKAGE: "2010-07-01 00:00:01.250000000"}),
    # A package that the configuration names is used whatever its time, and
    # a valid cache is then not looked at.
    drivers("package_named", PACKAGE_SLICE_ONLY, ("Loading Custom\\drivers.pk...", KERNEL_START),
            {**kernel_file(), "Custom/drivers.pk": PACKAGE_FILE,
             BOOT_PLIST: plist({"Drvpk Cache": "Custom/drivers.pk"})},
            times={**EXTENSIONS_TIME, "Custom/drivers.pk": "2001-01-01 00:00:00.000000000"},
            cache=CACHE_NOT_LOOKED_FOR, forbid=("Looking for kernel cache file",)),
    # Safe mode: neither the valid cache nor the valid package; the bundles,
    # without the "Safe Boot" one.
    drivers("drivers_safe_mode", expect=("Using Safe Mode", *FROM_BUNDLES), files=WITH_PACKAGE,
            config={"keys": "shift"}, times={**EXTENSIONS_TIME, DRIVER_PACKAGE: "2010-07-01 00:00:00.250000000"},
            cache=CACHE_NOT_LOOKED_FOR, forbid=("Extensions.drvpk...", "Looking for kernel cache file")),
]  # fmt: skip

SCENARIOS = {scenario.name: scenario for scenario in _TABLE}
assert len(SCENARIOS) == len(_TABLE), "scenario names must be unique"
