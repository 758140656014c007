#!/usr/bin/env bash
# Times a copy of a large file (256 MiB by default) from the Samba test share
# to ramfs: with the hosted shell's cp through the network volume, next to
# smbclient's get of the same file in the same run. Both runs read the file
# from a warm page cache on the server side and write to the same local file
# system. Uses a Release build without sanitizers (build/bench-volume).
#
#   bench-copy.sh [runs]        (SIZE_MIB=256 by default)
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
BUILD=${BUILD:-$ROOT/build/bench-volume}
RUNS=${1:-3}
SIZE_MIB=${SIZE_MIB:-256}
STATE_DIR=/tmp/cifsdrv-samba
SHARE_DIR=$STATE_DIR/share-smb2_10
SMB_USER=cifstest
SMB_PASS=Cifs-Test-Pw1
SMB_SHARE=cifsshare

echo "== Release build without sanitizers ($BUILD)"
cmake -S . -B "$BUILD" -G Ninja -DCIFSDRV_SANITIZE=OFF -DCMAKE_BUILD_TYPE=Release >/dev/null
ninja -C "$BUILD" -j2 integration_tests >/dev/null

# The server is shared with the test suites: (re)start it with this
# configuration before every measurement.
server() {
  SMB_STATE_DIR=$STATE_DIR SMB_MIN_PROTO=SMB2_02 SMB_MAX_PROTO=SMB2_10 SMB_USER=$SMB_USER \
    SMB_PASS=$SMB_PASS SMB_SHARE=$SMB_SHARE SMB_DIR=$SHARE_DIR \
    bash scripts/samba-test-server.sh start
}
echo "== Samba on loopback"
server

BENCH_DIR=$SHARE_DIR/bench-copy
OUT=$(mktemp -d)
cleanup() { rm -rf "$BENCH_DIR" "$OUT"; }
trap cleanup EXIT
mkdir -p "$BENCH_DIR"
chmod 0777 "$BENCH_DIR"
head -c $((SIZE_MIB * 1048576)) /dev/urandom >"$BENCH_DIR/big.bin"
chmod 0666 "$BENCH_DIR/big.bin"
cat "$BENCH_DIR/big.bin" >/dev/null # warm the server's page cache

now() { date +%s.%N; }
median() { sort -n | awk '{ v[NR] = $1 } END { print (NR % 2) ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2 }'; }
CP_TIMES=()
GET_TIMES=()
for run in $(seq 1 "$RUNS"); do
  echo "-- run $run"
  server
  line=$(CIFSDRV_BENCH_FILE=bench-copy/big.bin "$BUILD/tests/integration_tests" \
    --gtest_also_run_disabled_tests --gtest_filter='NwVolumeSambaTest.DISABLED_CopyBenchmark' |
    grep -E "^cp through") || { echo "benchmark test failed"; exit 1; }
  echo "$line"
  CP_TIMES+=("$(echo "$line" | awk '{ print $(NF - 3) }')")
  rm -f "$OUT/big.bin"
  server
  start=$(now)
  smbclient -m SMB2_10 "//127.0.0.1/$SMB_SHARE" -U "$SMB_USER%$SMB_PASS" \
    -c "get bench-copy/big.bin $OUT/big.bin" >"$OUT/smbclient.log" 2>&1 ||
    { cat "$OUT/smbclient.log"; exit 1; }
  end=$(now)
  cmp -s "$OUT/big.bin" "$BENCH_DIR/big.bin" || { echo "smbclient copy differs"; exit 1; }
  GET_TIMES+=("$(awk -v s="$start" -v e="$end" 'BEGIN { printf "%.3f", e - s }')")
  echo "smbclient get:         ${GET_TIMES[-1]} s"
done
cp_median=$(printf '%s\n' "${CP_TIMES[@]}" | median)
get_median=$(printf '%s\n' "${GET_TIMES[@]}" | median)
echo "== medians of $RUNS runs, $SIZE_MIB MiB"
awk -v c="$cp_median" -v g="$get_median" -v m="$SIZE_MIB" 'BEGIN {
  printf "cp through the volume to ramfs: %.3f s (%.1f MiB/s)\n", c, m / c
  printf "smbclient get:                  %.3f s (%.1f MiB/s)\n", g, m / g }'
