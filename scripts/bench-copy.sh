#!/usr/bin/env bash
# Times the hosted program's import of a large file (action "I", 256 MiB by
# default) from the Samba test share into ramfs:, next to smbclient's get of
# the same file into a file on the same disk, in alternating runs, and prints
# the medians, their ratio and the most pool bytes the image had in use at
# once during the import. Both read the file from a warm page cache on the
# server side. The file lies in the share's root: the import looks for its
# copy under the file's own directories in ramfs:, and copies a file from a
# directory that ramfs: lacks a second time. Uses a Release build without sanitizers (build/bench-volume).
#
#   bench-copy.sh [runs]        (5 by default; SIZE_MIB=256 by default)
#
# Run it in a private network and mount namespace when other Samba runs
# share the machine.
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
BUILD=${BUILD:-$ROOT/build/bench-volume}
RUNS=${1:-5}
SIZE_MIB=${SIZE_MIB:-256}
STATE_DIR=/tmp/cifsdrv-samba
SHARE_DIR=$STATE_DIR/share-smb2_10
SMB_USER=cifstest
SMB_PASS=Cifs-Test-Pw1
SMB_SHARE=cifsshare

echo "== Release build without sanitizers ($BUILD)"
cmake -S . -B "$BUILD" -G Ninja -DCIFSDRV_SANITIZE=OFF -DCMAKE_BUILD_TYPE=Release >/dev/null
ninja -C "$BUILD" -j2 cifsdrv >/dev/null

SMB_ENV=("SMB_STATE_DIR=$STATE_DIR" SMB_MIN_PROTO=SMB2_02 SMB_MAX_PROTO=SMB2_10 "SMB_USER=$SMB_USER"
  "SMB_PASS=$SMB_PASS" "SMB_SHARE=$SMB_SHARE" "SMB_DIR=$SHARE_DIR")
echo "== Samba on loopback"
env "${SMB_ENV[@]}" bash scripts/samba-test-server.sh start

# Both copies go to the same file system (/tmp: a tmpfs in the private
# namespace the tests run in, so that neither waits for a disk).
OUT=$(mktemp -d "${TMPDIR:-/tmp}/bench-copy.XXXXXX")
FILE=bench-copy.bin
cleanup() {
  rm -rf "${SHARE_DIR:?}/$FILE" "$OUT"
  env "${SMB_ENV[@]}" bash scripts/samba-test-server.sh stop >/dev/null 2>&1 || true
}
trap cleanup EXIT
mkdir -p "$OUT/ramfs"
head -c $((SIZE_MIB * 1048576)) /dev/urandom >"$SHARE_DIR/$FILE"
chmod 0666 "$SHARE_DIR/$FILE"
cat "$SHARE_DIR/$FILE" >/dev/null # warm the server's page cache

now() { date +%s.%N; }
median() { sort -g | awk '{ v[NR] = $1 } END { print (NR % 2) ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2 }'; }
IMPORT_TIMES=()
GET_TIMES=()
PEAKS=()
for run in $(seq 1 "$RUNS"); do
  rm -f "$OUT/ramfs/$FILE" "$OUT/vars.txt"
  start=$(now)
  rc=0
  CIFSDRV_RAMFS=$OUT/ramfs CIFSDRV_VARSTORE=$OUT/vars.txt CIFSDRV_POOL_PEAK=1 \
    "$BUILD/cifsdrv" I "$SMB_SHARE" 127.0.0.1 "$SMB_USER" "$SMB_PASS" "$FILE" \
    >"$OUT/import.log" 2>&1 || rc=$?
  end=$(now)
  if [ "$rc" -ne 0 ] || ! cmp -s "$OUT/ramfs/$FILE" "$SHARE_DIR/$FILE"; then
    tail -20 "$OUT/import.log"
    echo "the import failed (exit $rc) or its copy differs"
    exit 1
  fi
  IMPORT_TIMES+=("$(awk -v s="$start" -v e="$end" 'BEGIN { printf "%.3f", e - s }')")
  PEAKS+=("$(sed -n 's/^cifsdrv: pool peak: \([0-9]*\) bytes$/\1/p' "$OUT/import.log")")
  rm -f "$OUT/ramfs/$FILE"

  rm -f "$OUT/big.bin"
  start=$(now)
  smbclient -m SMB2_10 "//127.0.0.1/$SMB_SHARE" -U "$SMB_USER%$SMB_PASS" \
    -c "get $FILE $OUT/big.bin" >"$OUT/smbclient.log" 2>&1 ||
    { cat "$OUT/smbclient.log"; exit 1; }
  end=$(now)
  cmp -s "$OUT/big.bin" "$SHARE_DIR/$FILE" || { echo "smbclient copy differs"; exit 1; }
  rm -f "$OUT/big.bin"
  GET_TIMES+=("$(awk -v s="$start" -v e="$end" 'BEGIN { printf "%.3f", e - s }')")
  echo "run $run: import ${IMPORT_TIMES[-1]} s (pool peak ${PEAKS[-1]} bytes), smbclient get ${GET_TIMES[-1]} s"
done
import_median=$(printf '%s\n' "${IMPORT_TIMES[@]}" | median)
get_median=$(printf '%s\n' "${GET_TIMES[@]}" | median)
peak=$(printf '%s\n' "${PEAKS[@]}" | sort -g | tail -n 1)
echo "== medians of $RUNS runs, $SIZE_MIB MiB"
awk -v c="$import_median" -v g="$get_median" -v m="$SIZE_MIB" -v p="$peak" 'BEGIN {
  printf "cifsdrv I into ramfs:  %.3f s (%.1f MiB/s)\n", c, m / c
  printf "smbclient get:         %.3f s (%.1f MiB/s)\n", g, m / g
  printf "ratio get / import:    %.2f\n", g / c
  printf "pool peak:             %d bytes (%.2f MiB)\n", p, p / 1048576 }'
