#!/usr/bin/env bash
# Sets up a fresh Debian 12 machine and runs every test: the hosted build
# (unit, integration and end-to-end tests under AddressSanitizer and
# UndefinedBehaviorSanitizer) and the firmware image in QEMU/OVMF.
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)

bash scripts/install-deps.sh

JOBS=${JOBS:-$(nproc)}
echo "== Building the hosted program and tests (build/host)"
cmake -S . -B build/host -G Ninja -DCIFSDRV_PLATFORM=Host >/dev/null
ninja -C build/host -j"$JOBS"

echo "== Building the firmware image (build/efi)"
cmake -S . -B build/efi -G Ninja -DCIFSDRV_PLATFORM=Uefi \
  -DCMAKE_TOOLCHAIN_FILE="$ROOT/cmake/UefiToolchain.cmake" >/dev/null
ninja -C build/efi -j"$JOBS"

echo "== Hosted tests"
status=0
ctest --test-dir build/host --output-on-failure -j"$JOBS" || status=1

echo "== Firmware tests (QEMU/OVMF)"
for t in tests/firmware/run-*.sh; do
  [ -e "$t" ] || continue
  echo "-- $t"
  bash "$t" "$ROOT/build/efi" || status=1
done

if [ "$status" -ne 0 ]; then
  echo "SOME TESTS FAILED"
fi
exit "$status"
