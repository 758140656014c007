#!/usr/bin/env bash
# "e ... Import" (file import) against a Samba share on loopback: the path
# taken after ":\", the source types BKP and UnattendOsd, missing paths and
# other source types. (Action I: run-signing.sh and the relay runs; the retry
# of a path written with "/": TasksTest.)
#
# Usage: run-import.sh PATH_TO_CIFSDRV
set -u
E2E_HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$E2E_HERE/lib.sh"
e2e_init "${1:?usage: run-import.sh PATH_TO_CIFSDRV}"
e2e_share_start

# "e ... Import" with BKP and UnattendOsd, with and without a path; what
# follows the first ":\" is the path on the share, and the file lands in the
# root of ramfs:.
e2e_fresh
e2e_share_put backups/node7.img "backup image"
e2e_share_put unattend.xml "<unattend/>"
e2e_trade Import BKP 'fs0:\backups\node7.img'
e2e_check_run "Import BKP"
e2e_check "Import BKP: copied" e2e_same_file "$CIFSDRV_RAMFS/node7.img" "$SMB_DIR/backups/node7.img"
e2e_verify_status "Import BKP" 00
e2e_trade Import UnattendOsd unattend.xml
e2e_check_run "Import UnattendOsd"
e2e_check "Import UnattendOsd: copied" e2e_same_file "$CIFSDRV_RAMFS/unattend.xml" "$SMB_DIR/unattend.xml"
e2e_verify_status "Import UnattendOsd" 00

e2e_fresh
e2e_trade Import BKP
e2e_check "Import BKP without path: message" e2e_out_has "Backup file is NULL!"
e2e_verify_status "Import BKP without path" 0e
e2e_trade Import UnattendOsd
e2e_check "Import UnattendOsd without path: message" e2e_out_has "Unattended OS file is NULL!"
e2e_verify_status "Import UnattendOsd without path" 0e

# Any other source type does nothing and succeeds.
e2e_fresh
e2e_share_put other.img
e2e_trade Import XYZ other.img
e2e_check_run "Import XYZ"
e2e_check "Import XYZ: nothing copied" test -z "$(ls -A "$CIFSDRV_RAMFS")"
e2e_verify_status "Import XYZ" 00

e2e_finish
