#!/usr/bin/env bash
# Import speed of CIFSDrv.efi in the firmware, next to the firmware shell's
# own "http" command, in one OVMF boot under QEMU (TCG).
#
#   scripts/bench-firmware.sh [BUILD_DIR] [ROUNDS]
#
# BUILD_DIR holds CIFSDrv.efi (default build/efi, built first when missing).
# The guest reaches two servers on this machine's loopback through QEMU's
# user network (10.0.2.2 inside the guest): the Samba test server with the
# share "fwbench" and "python3 -m http.server" serving the same 8 MiB file.
# The startup script runs, ROUNDS times (default 5) in turn, a mount-only
# run of the image ("M"), an import of the file into ramfs: ("I") and the
# shell's "http" download of it into ramfs:, each between marker lines. The
# host stamps the marker lines as they reach the serial console; a step's
# time is the gap between its markers. The image's copy time is the import
# less the mount-only run of the same round. Both copies are then read back
# from the RAM disk with mtools and compared byte for byte with the file.
#
# Prints each round, the medians and the ratio http / image copy (above 1.0:
# the image is faster than the shell's http). FW_CONSOLE_DIR names a
# directory to keep the console log in. Run it in a private network and mount
# namespace when other Samba or QEMU runs share the machine.
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
BUILD_DIR=${1:-$ROOT/build/efi}
ROUNDS=${2:-5}
# shellcheck source=tests/firmware/lib.sh
source "$ROOT/tests/firmware/lib.sh"

if [ ! -f "$BUILD_DIR/CIFSDrv.efi" ]; then
  bash scripts/build-efi.sh "$BUILD_DIR" -j2 >/dev/null
fi
EFI=$BUILD_DIR/CIFSDrv.efi
fw_require_tools
for tool in python3 perl cmp; do
  command -v "$tool" >/dev/null || fw_die "$tool not found (run scripts/install-deps.sh)"
done

export SMB_USER=cifstest SMB_PASS=Cifs-Test-Pw1 SMB_SHARE=fwbench
export SMB_DIR=${SMB_STATE_DIR:-/tmp/cifsdrv-samba}/share-fwbench
SERVER=10.0.2.2
HTTP_PORT=${BENCH_HTTP_PORT:-8080}
FILE=bench.bin
BYTES=$((8 * 1048576))
LIMIT=$((120 + ROUNDS * 60))

fw_start_work fw-bench
bench_cleanup() {
  fw_cleanup_work
  rm -rf "$SMB_DIR"
  bash scripts/samba-test-server.sh stop >/dev/null 2>&1 || true
}
trap bench_cleanup EXIT

rm -rf "$SMB_DIR"
mkdir -p "$SMB_DIR" "$WORK/www"
head -c "$BYTES" /dev/urandom >"$SMB_DIR/$FILE"
cp "$SMB_DIR/$FILE" "$WORK/www/$FILE"
chown -R "$SMB_USER" "$SMB_DIR" 2>/dev/null || true
chmod -R a+rwX "$SMB_DIR"
bash scripts/samba-test-server.sh start

python3 -m http.server "$HTTP_PORT" --bind 127.0.0.1 --directory "$WORK/www" \
  >"$WORK/http.log" 2>&1 &
FW_CLEANUP_PIDS+=($!)
for _ in $(seq 1 50); do
  python3 -c "import socket; socket.create_connection(('127.0.0.1', $HTTP_PORT), 1)" \
    2>/dev/null && break
  sleep 0.1
done

# The RAM disk: room for both copies, and a marker by which it is found.
truncate -s 32M "$WORK/ramfs.img"
mformat -i "$WORK/ramfs.img" -v RAMFS :: || fw_die "mformat of the RAM disk failed"
echo "cifsdrv benchmark RAM disk" >"$WORK/marker"
mcopy -i "$WORK/ramfs.img" "$WORK/marker" ::/marker || fw_die "mcopy of the marker failed"

standard="$SMB_SHARE $SERVER $SMB_USER $SMB_PASS"
{
  cat <<'NSH'
@echo -off
connect -r
map -r
for %v in fs0 fs1 fs2 fs3
  if exist %v:\CIFSDrv.efi then
    set -v cifsdrv %v:\CIFSDrv.efi
  endif
  if exist %v:\marker then
    map ramfs %v:
  endif
endfor
NSH
  fw_nsh_network_wait
  echo "ramfs:"
  for round in $(seq 1 "$ROUNDS"); do
    echo "echo \"@@BEGIN mount $round\""
    echo "%cifsdrv% M $standard"
    echo "echo \"@@END mount $round %lasterror%\""
    echo "echo \"@@BEGIN import $round\""
    echo "%cifsdrv% I $standard $FILE"
    echo "echo \"@@END import $round %lasterror%\""
    echo "echo \"@@BEGIN http $round\""
    echo "http http://$SERVER:$HTTP_PORT/$FILE ramfs:\\http.bin"
    echo "echo \"@@END http $round %lasterror%\""
  done
  echo 'echo "@@DONE"'
  echo 'reset -s'
} | fw_write_startup "$WORK/startup.nsh"
fw_make_disk "$WORK/disk.img" "$EFI" "$WORK/startup.nsh"

FW_QEMU_ARGS=(
  -drive "if=none,id=ramfs,format=raw,file=$WORK/ramfs.img" -device "virtio-blk-pci,drive=ramfs"
  -netdev "user,id=n0" -device "virtio-net-pci,netdev=n0,romfile="
  -device virtio-rng-pci
)
# stamp_markers LOG OUT: in the background, follows the serial log LOG
# (which must not exist yet: fw_boot creates it) and writes each "@@" line it
# sees to OUT, prefixed with this machine's time in seconds. The follower is
# stopped with the boot's other helpers.
stamp_markers() {
  perl -MTime::HiRes=time,sleep -e '
    my ($log, $out) = @ARGV;
    open(my $o, ">", $out) or die "$out: $!";
    $o->autoflush(1);
    my $in;
    sleep 0.05 until open($in, "<", $log);
    my $pending = "";
    while (1) {
      my $n = sysread($in, my $chunk, 65536);
      if (!$n) { sleep 0.05; next; }
      $pending .= $chunk;
      while ($pending =~ s/^([^\n]*)\n//) {
        my $line = $1;
        $line =~ s/\e\[[0-9;?=]*[A-Za-z]//g;
        $line =~ s/[\r\s]+$//;
        printf $o "%.2f %s\n", time, $line if $line =~ /^@@/;
      }
    }
  ' "$1" "$2" &
  FW_CLEANUP_PIDS+=("$!")
}
stamp_markers "$WORK/serial.log" "$WORK/stamps.txt"
fw_boot "$WORK" "$LIMIT" || true
for _ in $(seq 1 40); do
  grep -q "@@DONE" "$WORK/stamps.txt" 2>/dev/null && break
  sleep 0.05
done
fw_clean_log "$WORK/serial.log" >"$WORK/console.txt"
if [ -n "${FW_CONSOLE_DIR:-}" ]; then
  mkdir -p "$FW_CONSOLE_DIR"
  cp "$WORK/console.txt" "$WORK/stamps.txt" "$FW_CONSOLE_DIR/"
fi
if ! grep -q "@@DONE" "$WORK/stamps.txt"; then
  KEEP_WORK=1
  fw_die "the startup script did not finish; console at $WORK/console.txt"
fi

# gap NAME ROUND: seconds between the step's two markers.
gap() {
  awk -v b="@@BEGIN $1 $2" -v e="@@END $1 $2" '
    { t = $1; $1 = ""; sub(/^ /, "") }
    $0 == b { start = t }
    index($0, e) == 1 { printf "%.2f", t - start; exit }' "$WORK/stamps.txt"
}
median() { sort -g | awk '{ v[NR] = $1 } END { print (NR % 2) ? v[(NR + 1) / 2] : (v[NR / 2] + v[NR / 2 + 1]) / 2 }'; }

copies=()
https=()
for round in $(seq 1 "$ROUNDS"); do
  mount=$(gap mount "$round")
  import=$(gap import "$round")
  http=$(gap http "$round")
  copy=$(awk -v i="$import" -v m="$mount" 'BEGIN { printf "%.2f", i - m }')
  copies+=("$copy")
  https+=("$http")
  echo "round $round: mount $mount s, import $import s (copy $copy s), http $http s"
done

# Byte for byte: the last round's copies.
ok=1
for name in "$FILE" http.bin; do
  rm -f "$WORK/back.bin"
  if mcopy -n -i "$WORK/ramfs.img" "::/$name" "$WORK/back.bin" 2>/dev/null &&
    cmp -s "$WORK/back.bin" "$SMB_DIR/$FILE"; then
    echo "ramfs:\\$name equals the file ($BYTES bytes)"
  else
    echo "ramfs:\\$name is missing or differs from the file" >&2
    ok=0
  fi
done
if grep '^[0-9.]* @@END' "$WORK/stamps.txt" | grep -vq ' 0x0$'; then
  echo "a step returned an error:" >&2
  grep '^[0-9.]* @@END' "$WORK/stamps.txt" | grep -v ' 0x0$' >&2
  ok=0
fi
if grep -q "Mount partition failed" "$WORK/console.txt"; then
  echo "a mount failed" >&2
  ok=0
fi

copy=$(printf '%s\n' "${copies[@]}" | median)
http=$(printf '%s\n' "${https[@]}" | median)
awk -v c="$copy" -v h="$http" -v n="$ROUNDS" -v mib=$((BYTES / 1048576)) 'BEGIN {
  printf "== medians of %d rounds, %d MiB\n", n, mib
  printf "CIFSDrv.efi import (less a mount): %.2f s (%.1f MiB/s)\n", c, (c > 0 ? mib / c : 0)
  printf "shell http:                        %.2f s (%.1f MiB/s)\n", h, (h > 0 ? mib / h : 0)
  printf "ratio http / import: %.2f\n", (c > 0 ? h / c : 0) }'
if [ "$ok" -ne 1 ]; then
  KEEP_WORK=1
  fw_die "a copy failed; console at $WORK/console.txt"
fi
