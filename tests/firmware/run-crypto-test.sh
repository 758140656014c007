#!/usr/bin/env bash
# Runs the crypto self-test image CryptoCheck.efi in QEMU/OVMF, three times:
# with a virtio RNG (random bytes from EFI_RNG_PROTOCOL), without it on a
# processor with RDRAND (-cpu max), and with neither (random bytes must then
# fail). Each run checks MD4, MD5, HMAC-MD5, HMAC-SHA256 and RC4 against
# their published vectors inside the firmware.
#
#   tests/firmware/run-crypto-test.sh BUILD_DIR   (the directory holding CryptoCheck.efi)
#
# Exit status 0 when every check passes.
set -euo pipefail

BUILD_DIR=${1:?usage: $0 BUILD_DIR}
HERE=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=tests/firmware/lib.sh
source "$HERE/lib.sh"

fw_setup crypto CryptoCheck.efi "$BUILD_DIR"


# "connect -r" binds the RNG device's driver; only the boot disk is connected
# when the shell starts.
fw_write_startup "$WORK/startup.nsh" <<'NSH'
@echo -off
connect -r
fs0:
fs0:\CryptoCheck.efi
echo "LASTERROR=%lasterror%"
echo "@@DONE"
reset -s
NSH
fw_make_disk "$WORK/disk.img" "$EFI" "$WORK/startup.nsh" CryptoCheck.efi

# crypto_run NAME EXPECTED_SOURCE QEMU_ARGS...
crypto_run() {
  local name=$1 source=$2 log started section result
  shift 2
  FW_QEMU_ARGS=("$@")
  started=$(date +%s)
  fw_boot "$WORK" 90 || true
  echo "crypto test ($name): QEMU ran $(($(date +%s) - started)) s"
  log="$WORK/console-$name.txt"
  fw_clean_log "$WORK/serial.log" >"$log"
  fw_check_contains "$log" "@@DONE" "$name: the image returned to the shell"
  fw_check_absent "$log" "X64 Exception" "$name: no processor exception"
  section=$(fw_section "$log" crypto-check)
  grep '^@@CHECK FAIL' <<<"$section" | sed "s/^/  $name: /" >&2 || true
  result=$(sed -n 's/^@@RESULT //p' <<<"$section")
  if [[ "$result" =~ ^([0-9]+)\ passed,\ 0\ failed$ ]] && [ "${BASH_REMATCH[1]}" -ge 21 ]; then
    fw_pass "$name: $result"
  else
    fw_fail "$name: checks in the firmware: ${result:-no result line}"
  fi
  fw_check_text "$section" "@@RANDOM $source" "$name: random bytes from $source"
  fw_check_contains "$log" "LASTERROR=0x0" "$name: the image returned EFI_SUCCESS"
}

crypto_run rng-device rng-protocol -net none -device virtio-rng-pci
crypto_run rdrand rdrand -net none -cpu max
crypto_run no-source none -net none

fw_finish crypto "$WORK"
