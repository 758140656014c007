#!/usr/bin/env bash
# Mount and unmount of a Samba share on loopback: action "m" alone, the exit
# value and VerifyStatus, and a server that is not there.
#
# Usage: run-mount.sh PATH_TO_CIFSDRV
set -u
E2E_HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$E2E_HERE/lib.sh"
e2e_init "${1:?usage: run-mount.sh PATH_TO_CIFSDRV}"
e2e_share_start

# "m" mounts, maps the share as CIFS and unmounts; nothing else.
e2e_fresh
e2e_share_put keep.txt
e2e_seed_verbose
e2e_run m "$SMB_SHARE" 127.0.0.1 Export VML "$SMB_USER" "$SMB_PASS"
e2e_check_run "m"
e2e_check "m: exit value 0" test "$E2E_RC" -eq 0
e2e_check "m: mounted" e2e_out_has "driveName = CIFS"
e2e_check "m: no export" e2e_out_lacks "entering in to ExporttoNWShare()"
e2e_check "m: unmounted" e2e_out_has "Exiting UnmountStaticFileSystem. Status = 0x0"
e2e_check "m: nothing copied" test -z "$(ls -A "$CIFSDRV_RAMFS")"
e2e_check "m: share untouched" test "$(ls -A "$SMB_DIR")" = keep.txt
e2e_verify_status "m" 00

# A server that is not there (nothing listens on 127.0.0.2): the outcome
# says so, the exit value is the unmount's.
e2e_fresh
e2e_run G "$SMB_SHARE" 127.0.0.2 "$SMB_USER" "$SMB_PASS"
e2e_check_run "no server"
e2e_check "no server: reported by main" e2e_out_has "Mount partition failed!"
e2e_check "no server: exit value 0" test "$E2E_RC" -eq 0
e2e_verify_status "no server" 07

e2e_finish
