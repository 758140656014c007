#!/usr/bin/env bash
# Connect-to-tree-connect time of the SMB2 client against the local Samba
# test server, as a median of 20, next to `smbclient -m SMB2_10 -c exit` for
# the same share in the same run.
#
#   scripts/bench-connect.sh [build-dir]
#
# Builds the integration runner without sanitizers (default build/bench,
# release flags) unless the given build directory already has it, and runs
# its timing test. The Samba server is started and stopped by the test.
set -euo pipefail
cd "$(dirname "$0")/.."
BUILD=${1:-build/bench}
JOBS=${JOBS:-2}

if [ ! -x "$BUILD/tests/integration_tests" ]; then
  cmake -S . -B "$BUILD" -G Ninja -DCIFSDRV_PLATFORM=Host -DCIFSDRV_SANITIZE=OFF \
    -DCMAKE_BUILD_TYPE=Release >/dev/null
fi
ninja -C "$BUILD" -j"$JOBS" tests/integration_tests >/dev/null
"$BUILD/tests/integration_tests" --gtest_also_run_disabled_tests \
  --gtest_filter='SambaTest.DISABLED_ConnectTimeNextToSmbclient' | grep -E 'median|OK|FAILED'
