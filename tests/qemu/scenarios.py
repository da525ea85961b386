"""The QEMU scenarios: each one a volume, the platform's configuration and
what the run must print and end with. harness.py runs them; CMakeLists.txt
registers one ctest test per name."""

import dataclasses

KERNEL_ERROR = "Error loading kernel 'nimb_kernel'"

# What every scenario's platform.cfg starts with, unless the scenario says
# otherwise: the platform records of the machine.
BASE_CONFIG = {
    "datahub.Model": "QEMU1,1",
    "datahub-hex.BusFrequency": "00e1f50500000000",  # 100 MHz, 64 bits
}

# The loader's configuration file on a volume boot.
BOOT_PLIST = "Library/Preferences/SystemConfiguration/com.quill.Boot.plist"


def plist(entries):
    """A configuration property list of string values."""
    body = "".join(f"\t<key>{key}</key>\n\t<string>{value}</string>\n" for key, value in entries.items())
    return f'<?xml version="1.0" encoding="UTF-8"?>\n<plist version="1.0">\n<dict>\n{body}</dict>\n</plist>\n'


@dataclasses.dataclass(frozen=True)
class Scenario:
    name: str
    # platform.cfg keys, over BASE_CONFIG; the file is left out when there
    # are none.
    config: dict = dataclasses.field(default_factory=dict)
    # Whether BASE_CONFIG goes in front of `config`.
    base_config: bool = True
    # Write platform.cfg even when `config` is empty.
    config_file: bool = False
    # Extra files of the ESP: path with '/' -> bytes, text or a host Path.
    files: dict = dataclasses.field(default_factory=dict)
    # ESP paths to leave out (e.g. the loader itself).
    remove: tuple = ()
    directories: tuple = ()
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
    # The platform's exit name (exitcodes.h without kExit) when the run is
    # to end before the loader comes back; overrides status and memory.
    exit: str | None = None
    timeout: float = 90.0


_TABLE = [
    Scenario(
        "no_kernel",
        expect=("platform: starting", KERNEL_ERROR, "platform: loader returned"),
        forbid=("WARNING: all of R,P,S exist",),
    ),
    # Also the platform without its configuration file.
    Scenario(
        "rps_all",
        base_config=False,
        directories=("com.quill.boot.R", "com.quill.boot.P", "com.quill.boot.S"),
        expect=(
            "platform: no platform.cfg, defaults used",
            "platform: starting",
            "WARNING: all of R,P,S exist: booting from 'R'",
            KERNEL_ERROR,
            "platform: loader returned",
        ),
    ),
    # The loader starts in text mode and gets load options, with blanks ahead
    # that it drops; the kernel they name shows that they arrived.
    Scenario(
        "text_console",
        config={"console": "text", "options": "  Kernel=nimb_test -v"},
        expect=("platform: starting", "console text", "Error loading kernel 'nimb_test'", "platform: loader returned"),
        forbid=(KERNEL_ERROR,),
    ),
    # Shift held alone: safe mode, which reads no NVRAM (the kernel that
    # boot-args names would win over the configuration file's), while the
    # configuration file still names the kernel.
    Scenario(
        "safe_mode_keys",
        config={"keys": "shift", "nvram.boot-args": "Kernel=nvram_kernel"},
        files={BOOT_PLIST: plist({"Kernel": "mach_test"})},
        expect=(
            "platform: nvram boot-args set",
            "platform: starting",
            "Using Safe Mode",
            "Error loading kernel 'mach_test'",
            "platform: loader returned",
        ),
        forbid=("nvram_kernel", KERNEL_ERROR),
    ),
    # GUI-V held: a verbose boot switches a graphics console to text before
    # anything else, and back to graphics only on the way out.
    Scenario(
        "verbose_text",
        config={"keys": "gui+v", "console": "graphics"},
        expect=(
            "platform: starting",
            "platform: console mode text",
            KERNEL_ERROR,
            "platform: console mode graphics",
            "platform: loader returned",
        ),
        console_modes=("text", "graphics"),
    ),
    # boot-args names the kernel. Shift is held too, but the boot policy says
    # that held keys are not to be read, so there is no safe mode to skip
    # NVRAM.
    Scenario(
        "nvram_args",
        config={"nvram.boot-args": "Kernel=from_nvram", "keys": "shift", "keys-ignored": "1"},
        expect=(
            "platform: keys: modifiers 0x2, 0 keys, ignored 1",
            "platform: nvram boot-args set, 17 bytes",
            "platform: starting",
            "Error loading kernel 'from_nvram'",
            "platform: loader returned",
        ),
        forbid=("Using Safe Mode", KERNEL_ERROR),
    ),
    # The platform's own way out: an unknown key is reported and ignored, and
    # a loader that isn't there ends the run before anything starts.
    Scenario(
        "platform_no_loader",
        base_config=False,
        config={"colour": "blue", "loader": "\\EFI\\BOOT\\missing.efi"},
        expect=(
            "platform: platform.cfg line 1: unknown key 'colour' ignored",
            "platform: error: loader \\EFI\\BOOT\\missing.efi not found (EFI_NOT_FOUND)",
        ),
        forbid=("platform: starting",),
        exit="LoaderMissing",
    ),
]

SCENARIOS = {scenario.name: scenario for scenario in _TABLE}
assert len(SCENARIOS) == len(_TABLE), "scenario names must be unique"
