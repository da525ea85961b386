#!/usr/bin/env bash
# Builds everything, boots the loader under QEMU in graphics mode and takes
# a screenshot of the screen it leaves.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh
cmake --preset host
cmake --build --preset host
python3 -B tests/qemu/harness.py --demo --efi-dir build/efi
echo "demo: the screenshot is $(pwd)/out/demo-screen.png"
