#!/usr/bin/env bash
# "e ... Export" against a Samba share on loopback: the log and the two
# inventories under names from the asset tag and the time, the backup image
# under a name from sysInfo.xml, the technical-support report file by file
# (where the shared write offset shows), and a refused source type.
#
# Usage: run-export.sh PATH_TO_CIFSDRV
set -u
E2E_HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$E2E_HERE/lib.sh"
e2e_init "${1:?usage: run-export.sh PATH_TO_CIFSDRV}"
e2e_share_start

readonly STAMP='D[0-9]{4}-[0-9]{2}-[0-9]{2}_T[0-9]{2}-[0-9]{2}-[0-9]{2}'

# check_export NAME SOURCE RAMFS_FILE DIR PATTERN: one run exported
# RAMFS_FILE into DIR of the share under a name matching PATTERN.
check_export() {
  local name=$1 source=$2 ramfs_file=$3 dir=$4 pattern=$5 found
  mkdir -p "$SMB_DIR/$dir" && chmod -R a+rwX "$SMB_DIR"
  e2e_trade Export "$source" "$dir"
  e2e_check_run "$name"
  e2e_check "$name: exit value 0" test "$E2E_RC" -eq 0
  e2e_verify_status "$name" 00
  found=$(find "$SMB_DIR/$dir" -maxdepth 1 -type f -printf '%f\n' | grep -E -x "$pattern")
  e2e_check "$name: exported as $pattern" test -n "$found"
  e2e_check "$name: content" e2e_same_file "$SMB_DIR/$dir/${found:-none}" "$CIFSDRV_RAMFS/$ramfs_file"
}

e2e_fresh
e2e_ramfs_put VelmorLog.xml "<log>velmor</log>"
e2e_ramfs_put HWInventory.xml "<hw/>"
e2e_ramfs_put SWInventory.xml "<sw/>"
check_export "VML" VML VelmorLog.xml exports "HOSTASSET_VelmorLog_${STAMP}\.xml"
check_export "HWI" HWI HWInventory.xml inv "HOSTASSET_HWInventory_${STAMP}\.xml"
check_export "ASI" ASI SWInventory.xml inv2 "HOSTASSET_SWInventory_${STAMP}\.xml"

e2e_fresh
head -c 200000 /dev/urandom >"$CIFSDRV_RAMFS/backup.img"
e2e_ramfs_put sysInfo.xml "<SystemInfo>
  <ServiceTag>7XK4Q2R</ServiceTag>
  <TimeStamp>2026-11-22T18:51:07</TimeStamp>
</SystemInfo>"
check_export "BKP" BKP backup.img backups "7XK4Q2R_Backup_D2026-11-22_T18-51-07\.img"

# The report's files go one after the other through the volume, whose write
# offset is shared by the whole run: the second file is written where the
# first one ended, so it arrives behind as many zero bytes as the first had.
e2e_fresh
mkdir -p "$SMB_DIR/case42" && chmod -R a+rwX "$SMB_DIR"
e2e_ramfs_put TSReport/a-system.log "first file of the report"
e2e_ramfs_put TSReport/b-hardware.txt "second"
e2e_trade Export DGRxyz case42
e2e_check_run "DGRxyz"
e2e_verify_status "DGRxyz" 00
e2e_check "DGRxyz: first file as it is" \
  e2e_same_file "$SMB_DIR/case42/a-system.log" "$CIFSDRV_RAMFS/TSReport/a-system.log"
first=$(stat -c %s "$CIFSDRV_RAMFS/TSReport/a-system.log")
e2e_check "DGRxyz: second file behind the first one's length of zeros" \
  cmp -s "$SMB_DIR/case42/b-hardware.txt" <(head -c "$first" /dev/zero; cat "$CIFSDRV_RAMFS/TSReport/b-hardware.txt")
e2e_check "DGRxyz: log redirected into ramfs:" test -e "$CIFSDRV_RAMFS/DGRLog.txt"

# "dgr" is not a technical-support export: refused before anything happens.
e2e_fresh
e2e_ramfs_put TSReport/a.log
e2e_trade Export dgr
e2e_check_run "dgr"
e2e_check "dgr: exit value 0" test "$E2E_RC" -eq 0
e2e_verify_status "dgr" 02
e2e_check "dgr: nothing exported" test -z "$(ls -A "$SMB_DIR")"

e2e_finish
