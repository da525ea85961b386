#!/usr/bin/env bash
# Installs the Debian packages that building, testing and the demo need,
# and only those that are missing. Runs as root (as CI does) or through sudo.
set -euo pipefail

packages=(
  # the compilers and the EFI linker
  clang lld llvm clang-format libclang-rt-14-dev
  # the build
  cmake ninja-build
  # libraries of the host build and its tests
  googletest libgtest-dev libbenchmark-dev zlib1g-dev libssl-dev
  # the QEMU scenarios and the demo
  qemu-system-x86 ovmf mtools gdisk python3
)

missing=()
for package in "${packages[@]}"; do
  if ! dpkg-query -W -f='${Status}' "$package" 2>/dev/null | grep -q 'install ok installed'; then
    missing+=("$package")
  fi
done

if [ ${#missing[@]} -eq 0 ]; then
  echo "install-deps: all ${#packages[@]} packages present"
  exit 0
fi

echo "install-deps: installing ${missing[*]}"
as_root=()
if [ "$(id -u)" -ne 0 ]; then
  as_root=(sudo)
fi
export DEBIAN_FRONTEND=noninteractive
"${as_root[@]}" apt-get update -q
"${as_root[@]}" env DEBIAN_FRONTEND=noninteractive apt-get install -y -q --no-install-recommends "${missing[@]}"
