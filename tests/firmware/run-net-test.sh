#!/usr/bin/env bash
# Runs the socket test image NetCheck.efi in QEMU/OVMF against net-peer.pl
# on this machine's loopback: connect, send and receive, a closed port, a
# peer that resets and a peer that goes silent, over the firmware's own TCP
# stack, over IPv4 and IPv6. The guest reaches the peer as 10.0.2.2 (and
# fec0::2) through QEMU's user-mode networking, which maps those addresses
# to this machine's loopback; the guest is given no other destination.
#
#   tests/firmware/run-net-test.sh BUILD_DIR   (the directory holding NetCheck.efi)
#
# Exit status 0 when every check passes.
set -euo pipefail

BUILD_DIR=${1:?usage: $0 BUILD_DIR}
HERE=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=tests/firmware/lib.sh
source "$HERE/lib.sh"

fw_setup net NetCheck.efi "$BUILD_DIR"
command -v perl >/dev/null || fw_die "perl not found"


# The peer lives a little longer than QEMU may.
QEMU_LIMIT=110
perl "$HERE/net-peer.pl" "$WORK/ports" $((QEMU_LIMIT + 10)) &
FW_CLEANUP_PIDS+=($!)
for _ in $(seq 1 50); do
  [ -s "$WORK/ports" ] && break
  sleep 0.1
done
[ -s "$WORK/ports" ] || fw_die "the peer did not start"
declare -A PORT
read -r -a pairs <"$WORK/ports"
for pair in "${pairs[@]}"; do
  PORT[${pair%%=*}]=${pair#*=}
done
echo "net test: peer ports $(cat "$WORK/ports")"

# IPv6 too when this machine has ::1: QEMU shows it to the guest as fec0::2.
IPV6_ARGS=""
if [ "${PORT[echo6]}" != 0 ]; then
  IPV6_ARGS="fec0::2 ${PORT[echo6]}"
else
  echo "net test: no IPv6 loopback here; the IPv6 echo is skipped"
fi

# Only the boot disk is connected when the shell starts: "connect -r" binds
# the NIC's drivers, then address configuration is started for both
# families; the image waits for its addresses.
fw_write_startup "$WORK/startup.nsh" <<NSH
@echo -off
connect -r
map -r
ifconfig -s eth0 dhcp
ifconfig6 -s eth0 auto
fs0:
fs0:\\NetCheck.efi 10.0.2.2 ${PORT[echo]} ${PORT[closed]} ${PORT[reset]} ${PORT[silent]} ${PORT[finish]} $IPV6_ARGS
echo "LASTERROR=%lasterror%"
echo "@@DONE"
reset -s
NSH
fw_make_disk "$WORK/disk.img" "$EFI" "$WORK/startup.nsh" NetCheck.efi

FW_QEMU_ARGS=(-netdev "user,id=net0" -device "virtio-net-pci,netdev=net0,romfile=")
started=$(date +%s)
fw_boot "$WORK" "$QEMU_LIMIT" || true
echo "net test: QEMU ran $(($(date +%s) - started)) s"

LOG="$WORK/console.txt"
fw_clean_log "$WORK/serial.log" >"$LOG"
fw_check_contains "$LOG" "@@DONE" "the image returned to the shell"
fw_check_absent "$LOG" "X64 Exception" "no processor exception"
section=$(fw_section "$LOG" net-check)
grep '^@@CHECK' <<<"$section" | sed 's/^@@CHECK /    /' || true
result=$(sed -n 's/^@@RESULT //p' <<<"$section")
if [[ "$result" =~ ^([0-9]+)\ passed,\ 0\ failed$ ]] && [ "${BASH_REMATCH[1]}" -ge 30 ]; then
  fw_pass "checks in the firmware: $result"
else
  fw_fail "checks in the firmware: ${result:-no result line}"
fi
fw_check_contains "$LOG" "LASTERROR=0x0" "the image returned EFI_SUCCESS"

fw_finish net "$LOG" 30
