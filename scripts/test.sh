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
passed=0
failed=0
if ctest --test-dir build/host --output-on-failure -j"$JOBS"; then
  passed=$((passed + 1))
else
  failed=$((failed + 1))
fi

echo "== Firmware tests (QEMU/OVMF)"
for t in tests/firmware/run-*.sh; do
  [ -e "$t" ] || continue
  echo "-- $t"
  if bash "$t" "$ROOT/build/efi"; then
    passed=$((passed + 1))
  else
    echo "FAILED: $t"
    failed=$((failed + 1))
  fi
done

# One line per suite above; this is the run's verdict.
echo "Suites: $passed passed, $failed failed"
[ "$failed" -eq 0 ]
