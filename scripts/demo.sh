#!/usr/bin/env bash
# Builds everything, then boots the reference kernel from a disk under QEMU
# in graphics mode: the platform layer starts the loader, the loader loads
# the kernel and enters it, and the kernel reports what it was handed on the
# serial port (printed as it comes) and holds the machine a few seconds, in
# which a screenshot of the boot screen is taken. The kernel comes from a
# kernel cache that kcache made of it and the test driver bundles.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh
cmake --preset host
cmake --build --preset host
python3 -B tests/qemu/harness.py --demo --efi-dir build/efi --guest-dir build/tests/guest --tools-dir build/tools
