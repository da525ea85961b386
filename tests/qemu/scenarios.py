"""The QEMU scenarios: each one a volume, the platform's configuration and
what the run must print and end with. harness.py runs them; CMakeLists.txt
registers one ctest test per name."""

import dataclasses

KERNEL_ERROR = "Error loading kernel 'nimb_kernel'"


@dataclasses.dataclass(frozen=True)
class Scenario:
    name: str
    # platform.cfg keys; the file is left out when there are none.
    config: dict = dataclasses.field(default_factory=dict)
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
    Scenario(
        "rps_all",
        directories=("com.quill.boot.R", "com.quill.boot.P", "com.quill.boot.S"),
        expect=(
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
    # The platform's own way out: an unknown key is reported and ignored, and
    # a loader that isn't there ends the run before anything starts.
    Scenario(
        "platform_no_loader",
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
