#!/usr/bin/env bash
# Installs the Debian packages that the build and the tests need: compilers
# and build tools, the firmware image's toolchain (clang, lld-link, gnu-efi's
# protocol headers; make, perl and dpkg-dev to fetch and prepare OpenSSL's
# sources for the image), QEMU and OVMF with mtools for the firmware tests,
# OpenSSL and GoogleTest for the hosted build, Samba and tshark for the
# network tests, python3 for the firmware benchmark's HTTP server.
#
# Idempotent: when every package is already installed, apt is not run at all.
# Works as root (no sudo needed), without a terminal and with CI=true.
set -euo pipefail

PACKAGES=(
  cmake ninja-build g++ clang lld gnu-efi make perl dpkg-dev
  libssl-dev googletest libgtest-dev
  qemu-system-x86 ovmf mtools
  samba smbclient tshark python3
)

missing=()
for package in "${PACKAGES[@]}"; do
  state=$(dpkg-query -W -f='${db:Status-Status}' "$package" 2>/dev/null || true)
  if [ "$state" != "installed" ]; then
    missing+=("$package")
  fi
done

if [ "${#missing[@]}" -eq 0 ]; then
  echo "install-deps: all ${#PACKAGES[@]} packages are installed"
  exit 0
fi

as_root=()
if [ "$(id -u)" -ne 0 ]; then
  if command -v sudo >/dev/null; then
    as_root=(sudo)
  else
    echo "install-deps: missing ${missing[*]}; run as root to install them" >&2
    exit 1
  fi
fi

echo "install-deps: installing ${missing[*]}"
export DEBIAN_FRONTEND=noninteractive
# tshark asks whether non-root users may capture; answer no in advance.
echo "wireshark-common wireshark-common/install-setuid boolean false" |
  "${as_root[@]}" debconf-set-selections
"${as_root[@]}" apt-get update </dev/null
"${as_root[@]}" env DEBIAN_FRONTEND=noninteractive \
  apt-get install -y --no-install-recommends "${missing[@]}" </dev/null
