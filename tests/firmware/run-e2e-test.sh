#!/usr/bin/env bash
# CIFSDrv.efi end to end in QEMU/OVMF against the Samba test server: every
# action run from the firmware's own UEFI Shell over the firmware's own TCP
# stack, then the results read back from outside the machine.
#
#   tests/firmware/run-e2e-test.sh BUILD_DIR   (the directory holding CIFSDrv.efi)
#
# The share "fwe2e" (loopback, port 445) holds a catalog, its signature, an
# 8 MiB file to import and an empty export directory, and requires signing
# ("server signing = mandatory"): every run signs with the image's own
# SHA-256. QEMU's user-mode network shows this machine's loopback to the guest
# as 10.0.2.2, its only server address. A second FAT disk, found by
# startup.nsh through its marker file, is mapped as ramfs: and holds the log to
# export. One boot runs "m", "G", "S", "I", "e ... Export VML", "E" and a
# wrong password, each followed by its %lasterror% and the outcome variable;
# then the RAM disk is read back with mtools and compared byte for byte with
# the share, and the share is searched for the exported log.
#
# Settings: FW_E2E_DEBUG_LEVEL (driver debug level stored before the runs),
# FW_E2E_LIMIT (time limit of the boot, 150 s), FW_CONSOLE_DIR (where the
# console log is copied). Exit status 0 when every check passes.
set -euo pipefail

BUILD_DIR=${1:?usage: $0 BUILD_DIR}
HERE=$(cd "$(dirname "$0")" && pwd)
REPO=$(cd "$HERE/../.." && pwd)
# shellcheck source=tests/firmware/lib.sh
source "$HERE/lib.sh"

fw_setup fw-e2e CIFSDrv.efi "$BUILD_DIR"
for tool in perl cmp gzip; do
  command -v "$tool" >/dev/null || fw_die "$tool not found (run scripts/install-deps.sh)"
done

DEBUG_LEVEL=${FW_E2E_DEBUG_LEVEL:-}
FIRST_LIMIT=${FW_E2E_LIMIT:-150}

export SMB_USER=cifstest
export SMB_PASS=Cifs-Test-Pw1
export SMB_SHARE=fwe2e
export SMB_SIGNING=mandatory
export SMB_DIR=${SMB_STATE_DIR:-/tmp/cifsdrv-samba}/share-fwe2e
SAMBA="$REPO/scripts/samba-test-server.sh"
SERVER=10.0.2.2
ASSET_TAG=FWE2EASSET
IMPORT_FILE=update.bin
IMPORT_BYTES=$((8 * 1024 * 1024))

PROVISIONING_GUID=4C4AC96B-DD0A-447E-8118-105900DA8629
PU_GUID=4D4AC77B-DD0A-447E-8117-104901DA8679
CATALOG_GUID=806E07A4-AE56-11E1-A464-FE1F6188709B
DEBUG_GUID=47C7B224-C42A-11D2-8E57-00A0C969723B

mkdir -p "$WORK/local" "$WORK/back"
# At exit: QEMU's helpers and the work directory (lib.sh), then the share's
# files and the server, as the other Samba tests leave it.
e2e_cleanup() {
  fw_cleanup_work
  if [ "$KEEP_WORK" -eq 0 ]; then
    rm -rf "$SMB_DIR"
  fi
  bash "$SAMBA" stop >/dev/null 2>&1 || true
}
trap e2e_cleanup EXIT

# --- The share, the exported log and the RAM disk ------------------------------

# A catalog of several read chunks and a partial one, its signature, the
# file to import and the export directory.
make_share() {
  rm -rf "$SMB_DIR"
  mkdir -p "$SMB_DIR/catalog" "$SMB_DIR/exports"
  {
    echo '<?xml version="1.0" encoding="utf-8"?>'
    echo '<Manifest baselineName="fwe2e">'
    head -c 150000 /dev/urandom | od -An -tx1 -v | sed 's/^ */  <Component hash="/; s/ *$/"\/>/'
    echo '</Manifest>'
  } | gzip -n -9 >"$SMB_DIR/catalog/catalog.xml.gz"
  head -c 512 /dev/urandom >"$SMB_DIR/catalog/catalog.xml.gz.sign"
  head -c "$IMPORT_BYTES" /dev/urandom >"$SMB_DIR/$IMPORT_FILE"
  chown -R "$SMB_USER" "$SMB_DIR" 2>/dev/null || true
  chmod -R a+rwX "$SMB_DIR"
}

make_log() {
  {
    echo '<?xml version="1.0" encoding="utf-8"?>'
    echo '<VelmorLog>'
    for i in $(seq 1 400); do
      echo "  <Event seq=\"$i\">firmware end-to-end run entry $i</Event>"
    done
    echo '</VelmorLog>'
  } >"$WORK/local/VelmorLog.xml"
}

# The second disk: a marker by which startup.nsh finds it, and the log.
make_ramfs_disk() {
  local disk=$WORK/ramfs.img
  rm -f "$disk"
  truncate -s 32M "$disk"
  mformat -i "$disk" -v RAMFS :: || fw_die "mformat of the RAM disk failed"
  echo "cifsdrv firmware end-to-end RAM disk" >"$WORK/local/marker"
  mcopy -i "$disk" "$WORK/local/marker" ::/marker || fw_die "mcopy of the marker failed"
  mcopy -i "$disk" "$WORK/local/VelmorLog.xml" ::/VelmorLog.xml || fw_die "mcopy of the log failed"
}

# --- The startup scripts ----------------------------------------------------------

# Only the boot disk is connected when the shell starts. %cifsdrv% names
# the image wherever the boot disk was mapped.
nsh_connect() {
  cat <<'NSH'
connect -r
map -r
for %v in fs0 fs1 fs2 fs3
  if exist %v:\CIFSDrv.efi then
    set -v cifsdrv %v:\CIFSDrv.efi
    set -v bootfs %v
  endif
endfor
NSH
}

# The RAM disk by its marker, then the network.
nsh_ramfs_and_network() {
  cat <<'NSH'
for %v in fs0 fs1 fs2 fs3
  if exist %v:\marker then
    map ramfs %v:
  endif
endfor
if exist ramfs:\marker then
  echo "@@RAMFS mapped"
endif
NSH
  fw_nsh_network_wait
  cat <<'NSH'
if "%netup%" == "1" then
  echo "@@NET up"
endif
NSH
  if [ -n "$DEBUG_LEVEL" ]; then
    echo "setvar QVUIkestDebugLevel -guid $DEBUG_GUID -bs =\"$DEBUG_LEVEL\""
  fi
}

# nsh_step NAME ARGUMENTS [EXTRA_COMMANDS]: one run of the image between
# markers, its %lasterror% and the outcome variable.
nsh_step() {
  cat <<NSH
echo "@@BEGIN $1"
%cifsdrv% $2
echo "LASTERROR=%lasterror%"
echo "@@RETURNED $1"
dmpstore -guid $PROVISIONING_GUID PROVISIONING_ENV_VOLATILE_VAR
${3:-}
echo "@@END $1"
NSH
}

nsh_finish() {
  printf '%s\n' 'echo "@@DONE"' 'reset -s'
}

# The text-field record, all fields empty, so that "G" can remember its
# directory for "S".
nsh_seed_text_fields() {
  printf 'setvar PUPROVISIONING_ENV_VAR -guid %s -bs -nv =%s\n' "$PU_GUID" "$(printf '0%.0s' $(seq 2304))"
}

first_boot_steps() {
  local standard="$SMB_SHARE $SERVER $SMB_USER $SMB_PASS"
  nsh_seed_text_fields
  nsh_step mount "m $SMB_SHARE $SERVER Export VML $SMB_USER $SMB_PASS"
  nsh_step catalog "G $standard" "$(printf '%s\n' \
    "dmpstore -guid $CATALOG_GUID CATALOGFILE_ENV_VAR" \
    "dmpstore -guid $PU_GUID PUPROVISIONING_ENV_VAR")"
  nsh_step signature "S $standard"
  nsh_step import "I $standard $IMPORT_FILE"
  nsh_step export "e $SMB_SHARE $SERVER Export VML $SMB_USER $SMB_PASS exports"
  nsh_step upper-e "E $standard"
  nsh_step bad-password "m $SMB_SHARE $SERVER Export VML $SMB_USER Wrong-Password-7"
}

# write_scripts STEPS_FUNCTION: startup.nsh and the boot disk holding it.
write_scripts() {
  {
    echo "@echo -off"
    nsh_connect
    nsh_ramfs_and_network
    "$1"
    nsh_finish
  } | fw_write_startup "$WORK/startup.nsh"
  fw_make_disk "$WORK/disk.img" "$EFI" "$WORK/startup.nsh"
}

# --- Running QEMU -----------------------------------------------------------------

# The server's process ids and share: a change during a run means that
# another test restarted or stopped it under us.
samba_identity() {
  bash "$SAMBA" status 2>/dev/null || true
  grep -F "path = $SMB_DIR" "${SMB_STATE_DIR:-/tmp/cifsdrv-samba}/smb.conf" 2>/dev/null || true
}

start_samba() {
  for _ in 1 2 3 4 5 6 7 8 9 10; do
    bash "$SAMBA" start && return 0
    sleep 3
  done
  fw_die "the Samba test server could not be started"
}

# boot NAME LIMIT NETDEV: one boot; the console goes to WORK/console-NAME.txt.
boot() {
  local name=$1 limit=$2 netdev=$3 started
  FW_QEMU_ARGS=(
    -drive "if=none,id=ramfs,format=raw,file=$WORK/ramfs.img" -device "virtio-blk-pci,drive=ramfs"
    -netdev "$netdev" -device "virtio-net-pci,netdev=n0,romfile="
    -device virtio-rng-pci -smbios "type=3,asset=$ASSET_TAG"
  )
  started=$(date +%s)
  fw_boot "$WORK" "$limit" || true
  echo "e2e test ($name): QEMU ran $(($(date +%s) - started)) s"
  fw_clean_log "$WORK/serial.log" >"$WORK/console-$name.txt"
}

# The first boot, once more when the server changed under it or refused the
# very first connection (another engineer's test restarting the shared
# server); the share and the RAM disk are made afresh for the second try.
run_first_boot() {
  local before after mount
  for _ in 1 2; do
    make_share
    make_ramfs_disk
    start_samba
    before=$(samba_identity)
    boot first "$FIRST_LIMIT" "user,id=n0"
    after=$(samba_identity)
    mount=$(fw_section "$WORK/console-first.txt" mount)
    if [ "$before" = "$after" ] && ! grep -q "Connection refused" <<<"$mount"; then
      return 0
    fi
    echo "e2e test: the Samba server was restarted or stopped during the run; trying again" >&2
  done
}

make_log
write_scripts first_boot_steps
run_first_boot

# --- Checks -------------------------------------------------------------------------

FIRST="$WORK/console-first.txt"
if [ -n "${FW_CONSOLE_DIR:-}" ]; then
  mkdir -p "$FW_CONSOLE_DIR"
  cp "$FIRST" "$FW_CONSOLE_DIR/"
fi

# check_returned TEXT NAME: the image came back to the shell and the shell
# went on. Fails (status 1) when the step never started or never returned;
# the step's other checks are then left out.
check_returned() {
  if ! grep -qxF "@@BEGIN $2" <<<"$1"; then
    fw_fail "$2: not reached (an earlier step did not return)"
    return 1
  fi
  if ! grep -qxF "@@RETURNED $2" <<<"$1"; then
    fw_fail "$2: the image did not return to the shell before the time limit;" \
      "the console ends with: $(grep -v '^$' <<<"$1" | tail -n 1)"
    return 1
  fi
  fw_check_text "$1" "@@END $2" "$2: the shell went on after it"
  fw_check_absent_text "$1" "X64 Exception" "$2: no processor exception"
}

# check_is WHAT VALUE WANT
check_is() {
  if [ "$2" = "$3" ]; then fw_pass "$1 $2"; else fw_fail "$1 ${2:-missing}, want $3"; fi
}

check_success() {
  local text
  text=$(fw_section "$FIRST" "$1")
  check_returned "$text" "$1" || return 0
  fw_check_text "$text" "LASTERROR=0x0" "$1: image returned EFI_SUCCESS"
  fw_check_absent_text "$text" "Mount partition failed!" "$1: the share mounted"
  fw_check_absent_text "$text" "Drive name len" "$1: the mounted share got a shell name"
  check_is "$1: VerifyStatus" "$(fw_verify_status "$text")" 00
}

# check_failed_mount FILE NAME: the mount failed and the run still ended
# cleanly: outcome recorded, unmount succeeded.
check_failed_mount() {
  local text value
  text=$(fw_section "$1" "$2")
  check_returned "$text" "$2" || return 0
  fw_check_text "$text" "Mount partition failed!" "$2: the mount failed"
  fw_check_text "$text" "LASTERROR=0x0" "$2: the unmount still succeeded (exit value 0)"
  value=$(fw_verify_status "$text")
  if [ -n "$value" ] && [ "$value" != 00 ] && [ "$value" != 0E ]; then
    fw_pass "$2: VerifyStatus records the failure (0x$value)"
  else
    fw_fail "$2: VerifyStatus ${value:+0x}${value:-missing}, want the mount's error"
  fi
}

# readback NAME: copies ramfs:\NAME out of the RAM disk image; prints its path,
# nothing when it is not there.
readback() {
  rm -f "$WORK/back/$1"
  if mcopy -n -i "$WORK/ramfs.img" "::/$1" "$WORK/back/$1" 2>/dev/null; then
    echo "$WORK/back/$1"
  fi
}

# check_same DESCRIPTION RAMFS_NAME SHARE_FILE: byte for byte; a copy that
# stopped short is reported with its size.
check_same() {
  local copy
  copy=$(readback "$2")
  if [ -n "$copy" ] && cmp -s "$copy" "$3"; then
    fw_pass "$1: ramfs:\\$2 equals the share's copy ($(stat -c %s "$3") bytes)"
  else
    fw_fail "$1: ramfs:\\$2 is missing or differs: ${copy:+$(stat -c %s "$copy") bytes,} $(cmp "$copy" "$3" 2>&1 | head -n 1)"
  fi
}

fw_check_contains "$FIRST" "@@DONE" "first boot: the startup script ran to its end"
fw_check_contains "$FIRST" "@@RAMFS mapped" "first boot: the second disk was found by its marker and mapped as ramfs:"
fw_check_contains "$FIRST" "@@NET up" "first boot: the network came up (DHCP)"

check_success mount

check_success catalog
catalog=$(fw_section "$FIRST" catalog)
check_same "catalog" catalog.xml.gz "$SMB_DIR/catalog/catalog.xml.gz"
check_is "catalog: CATALOGFILE_ENV_VAR (kind 2, catalog.xml.gz)" \
  "$(fw_var_hex "$catalog" "$CATALOG_GUID" CATALOGFILE_ENV_VAR)" 02000000
fields=$(fw_var_hex "$catalog" "$PU_GUID" PUPROVISIONING_ENV_VAR)
check_is "catalog: the directory remembered" "$(fw_hex_text "${fields:768:256}")" 'CIFS:\catalog'

check_success signature
check_same "signature" catalog.xml.gz.sign "$SMB_DIR/catalog/catalog.xml.gz.sign"

check_success import
check_same "import" "$IMPORT_FILE" "$SMB_DIR/$IMPORT_FILE"

check_success export
exported=$(find "$SMB_DIR/exports" -maxdepth 1 -type f -printf '%f\n' | sort)
pattern="^${ASSET_TAG}_VelmorLog_D[0-9]{4}-[0-9]{2}-[0-9]{2}_T[0-9]{2}-[0-9]{2}-[0-9]{2}\.xml$"
if [ "$(grep -c . <<<"$exported")" -eq 1 ] && grep -Eq "$pattern" <<<"$exported"; then
  fw_pass "export: the share holds exports\\$exported"
  if cmp -s "$SMB_DIR/exports/$exported" "$WORK/local/VelmorLog.xml"; then
    fw_pass "export: it equals ramfs:\\VelmorLog.xml"
  else
    fw_fail "export: exports\\$exported ($(stat -c %s "$SMB_DIR/exports/$exported") bytes) differs from" \
      "ramfs:\\VelmorLog.xml ($(stat -c %s "$WORK/local/VelmorLog.xml") bytes)"
  fi
else
  fw_fail "export: want one file named like ${ASSET_TAG}_VelmorLog_D<date>_T<time>.xml in exports," \
    "found: $(tr '\n' ' ' <<<"${exported:-nothing}")"
fi

# Upper-case "E" reads the standard layout: no trade type, nothing exported
# (the single file above is the one of "e").
check_success upper-e

check_failed_mount "$FIRST" bad-password

echo "e2e test: CIFSDrv.efi is $(stat -c %s "$EFI") bytes"

fw_finish e2e "$FIRST"
