#!/usr/bin/env bash
# Builds everything, then boots the reference kernel from a disk under QEMU
# in graphics mode: the platform layer starts the loader, the loader loads
# the kernel and enters it, and the kernel reports what it was handed on the
# serial port (printed as it comes) and holds the machine a few seconds, in
# which a screenshot of the boot screen is taken. The kernel comes from a
# kernel cache that kcache made of it and the test driver bundles.
#
# scripts/demo.sh --net boots the reference kernel over the network instead:
# the machine has no disk; QEMU's TFTP server serves a directory with the
# platform layer (the boot file that the firmware's PXE starts), the loader,
# the kernel and its driver package, and the loader fetches them by name.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh
cmake --preset host
cmake --build --preset host
python3 -B tests/qemu/harness.py --demo "$@" --efi-dir build/efi --guest-dir build/tests/guest --tools-dir build/tools
