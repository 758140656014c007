#!/usr/bin/env bash
# Configures and builds the firmware image: BUILD_DIR/CIFSDrv.efi
# (default build/efi). Extra arguments go to ninja, e.g. -j2.
#
#   scripts/build-efi.sh [BUILD_DIR] [ninja arguments...]
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
BUILD_DIR=${1:-build/efi}
shift || true

cmake -S "$ROOT" -B "$BUILD_DIR" -G Ninja -DCIFSDRV_PLATFORM=Uefi \
  -DCMAKE_TOOLCHAIN_FILE="$ROOT/cmake/UefiToolchain.cmake" >/dev/null
ninja -C "$BUILD_DIR" "$@"
echo "built $BUILD_DIR/CIFSDrv.efi"
