#!/usr/bin/env bash
# Read throughput of the network library next to smbclient, on the local
# Samba test server (scripts/samba-test-server.sh, dialect 2.1):
#
#   bash scripts/bench-read.sh [SIZE_MIB] [--profile]
#
# Builds a non-sanitized Release tree (build/bench-read) with the benchmark
# program scripts/bench/BenchRead.cpp, writes a file of SIZE_MIB MiB
# (default 256) into the share, reads it five times through GEE_NWFRead in
# 1 MiB calls (the largest read the volume makes) and five
# times with "smbclient -m SMB2_10 -c 'get FILE /dev/null'", and prints
# each time and the two medians. With --profile it also runs one read of a
# 32 MiB file under callgrind and prints where the instructions go.
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)

SIZE_MIB=${1:-256}
PROFILE=${2:-}
BUILD=${BENCH_BUILD_DIR:-$ROOT/build/bench-read}
STATE_DIR=/tmp/cifsdrv-samba
SHARE_DIR=$STATE_DIR/share-smb2_10
USER_NAME=cifstest
PASSWORD=Cifs-Test-Pw1
SHARE=cifsshare
FILE=bench-read-${SIZE_MIB}m.bin

export SMB_STATE_DIR=$STATE_DIR SMB_MIN_PROTO=SMB2_02 SMB_MAX_PROTO=SMB2_10
export SMB_USER=$USER_NAME SMB_PASS=$PASSWORD SMB_SHARE=$SHARE SMB_DIR=$SHARE_DIR

echo "== Release build without sanitizers ($BUILD)"
cmake -S . -B "$BUILD" -G Ninja -DCIFSDRV_SANITIZE=OFF -DCIFSDRV_BENCH=ON \
  -DCMAKE_BUILD_TYPE=Release >/dev/null
ninja -C "$BUILD" -j2 bench-read >/dev/null
BENCH=("$BUILD/bench-read" 127.0.0.1 "$SHARE" "$USER_NAME" "$PASSWORD")
trap 'bash scripts/samba-test-server.sh stop' EXIT

echo "== Samba and a ${SIZE_MIB} MiB file"
bash scripts/samba-test-server.sh start
if [ ! -f "$SHARE_DIR/$FILE" ] || [ "$(stat -c %s "$SHARE_DIR/$FILE")" -ne $((SIZE_MIB * 1048576)) ]; then
  head -c $((SIZE_MIB * 1048576)) /dev/urandom >"$SHARE_DIR/$FILE"
  chown "$USER_NAME" "$SHARE_DIR/$FILE"
fi
# Warm the page cache so that both clients read from memory.
cat "$SHARE_DIR/$FILE" >/dev/null

median() { sort -g | awk '{ v[NR] = $1 } END { print v[int((NR + 1) / 2)] }'; }

echo "== GEE_NWFRead"
"${BENCH[@]}" "$FILE" $((SIZE_MIB * 1048576)) | grep '^bench-read:'

echo "== smbclient -m SMB2_10 -c 'get $FILE /dev/null'"
times=()
for round in 1 2 3 4 5; do
  start=$(date +%s.%N)
  if ! smbclient "//127.0.0.1/$SHARE" -U "$USER_NAME%$PASSWORD" -m SMB2_10 \
    -c "get $FILE /dev/null" >/tmp/bench-read-smbclient.log 2>&1; then
    cat /tmp/bench-read-smbclient.log >&2
    exit 1
  fi
  end=$(date +%s.%N)
  t=$(echo "$end - $start" | bc -l)
  times+=("$t")
  printf 'smbclient: round %d %.3f s %.1f MiB/s\n' "$round" "$t" "$(echo "$SIZE_MIB / $t" | bc -l)"
done
m=$(printf '%s\n' "${times[@]}" | median)
printf 'smbclient: median %.3f s %.1f MiB/s\n' "$m" "$(echo "$SIZE_MIB / $m" | bc -l)"

if [ "$PROFILE" = "--profile" ]; then
  echo "== callgrind, one read of 32 MiB"
  small=bench-read-32m.bin
  if [ ! -f "$SHARE_DIR/$small" ]; then
    head -c $((32 * 1048576)) /dev/urandom >"$SHARE_DIR/$small"
    chown "$USER_NAME" "$SHARE_DIR/$small"
  fi
  out=$(mktemp /tmp/bench-read-callgrind.XXXXXX)
  valgrind --tool=callgrind --callgrind-out-file="$out" \
    "${BENCH[@]}" "$small" $((32 * 1048576)) 1 >/dev/null 2>&1
  # Instructions spent in the client's own code (the connect's share is
  # mostly the random bytes of the NTLM exchange).
  callgrind_annotate --inclusive=yes "$out" 2>/dev/null |
    grep -E 'PROGRAM TOTALS|GEE_NW|SMB2_FRead|SMB2_Read|SMB2Read|SMB2Send|TCP_Poll|SetOperationStatus|RtSetVariable' |
    head -20
  rm -f "$out"
  echo "== wall time in system calls of one read of $SIZE_MIB MiB (strace -w -c, client only)"
  strace -w -c -o /tmp/bench-read-strace.txt "${BENCH[@]}" "$FILE" $((SIZE_MIB * 1048576)) 1 |
    grep '^bench-read:'
  head -9 /tmp/bench-read-strace.txt
fi
