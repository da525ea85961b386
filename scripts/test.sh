#!/usr/bin/env bash
# The one test command: dependencies, the host build (which builds the EFI
# programs too), then every test, unit and QEMU. ctest's summary is the last
# thing printed, and its status is the script's.
set -euo pipefail
cd "$(dirname "$0")/.."

bash scripts/install-deps.sh
cmake --preset host
cmake --build --preset host
exec ctest --preset host
