#!/usr/bin/env bash
# Action I and "e ... Import" (file import) against a Samba share on
# loopback: the path trimming, the retry with "\", the source types BKP and
# UnattendOsd, missing paths, and a file large enough to take many reads.
#
# Usage: run-import.sh PATH_TO_CIFSDRV
set -u
E2E_HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$E2E_HERE/lib.sh"
source "$E2E_HERE/../support/e2e-share.sh"
e2e_init "${1:?usage: run-import.sh PATH_TO_CIFSDRV}"
e2e_share_start

# Everything after the first ":\" is the path on the share.
e2e_fresh
e2e_share_put dir/f.img "image in dir"
e2e_cifsdrv I 'ramfs:\dir\f.img'
e2e_check_run "ramfs:\\dir\\f.img"
e2e_check "ramfs:\\dir\\f.img: trimmed" e2e_out_has 'Found :\ in the file path'
e2e_check "ramfs:\\dir\\f.img: copied from dir\\f.img" \
  e2e_out_has 'command = [cp -q CIFS:\dir\f.img ramfs:\]'
e2e_check "ramfs:\\dir\\f.img: landed in the root" \
  e2e_same_file "$CIFSDRV_RAMFS/f.img" "$SMB_DIR/dir/f.img"
e2e_check "ramfs:\\dir\\f.img: exit value 0" test "$E2E_RC" -eq 0
e2e_verify_status "ramfs:\\dir\\f.img" 00

# A path written with "/": the check looks for the file under its
# directories, so the command is retried with "\" and the copy still counts.
e2e_fresh
e2e_share_put sub/dir/g.img "image in sub/dir"
e2e_cifsdrv I 'sub/dir/g.img'
e2e_check_run "path with /"
e2e_check "path with /: first as written" e2e_out_has 'command = [cp -q CIFS:\sub/dir/g.img ramfs:\]'
e2e_check "path with /: retried with \\" e2e_out_has 'command = [cp -q CIFS:\sub\dir\g.img ramfs:\]'
e2e_check "path with /: copied" e2e_same_file "$CIFSDRV_RAMFS/g.img" "$SMB_DIR/sub/dir/g.img"
e2e_verify_status "path with /" 00

# A 3 MiB file: many reads, byte for byte.
e2e_fresh
mkdir -p "$SMB_DIR/big"
head -c 3145728 /dev/urandom >"$SMB_DIR/big/large.bin"
chmod -R a+rwX "$SMB_DIR"
e2e_cifsdrv I 'big\large.bin'
e2e_check_run "large file"
e2e_check "large file: identical" e2e_same_file "$CIFSDRV_RAMFS/large.bin" "$SMB_DIR/big/large.bin"
e2e_verify_status "large file" 00

# A file that is not on the share.
e2e_fresh
e2e_cifsdrv I 'absent.img'
e2e_check_run "absent file"
e2e_check "absent file: reported" e2e_out_has "GetFileFromNWFS(): command failed"
e2e_check "absent file: exit value 0" test "$E2E_RC" -eq 0
e2e_verify_status "absent file" 0e

# Action I without a path.
e2e_fresh
e2e_cifsdrv I
e2e_check_run "I without path"
e2e_verify_status "I without path" 0e

# "e ... Import" with BKP and UnattendOsd.
e2e_fresh
e2e_share_put backups/node7.img "backup image"
e2e_trade Import BKP 'fs0:\backups\node7.img'
e2e_check_run "Import BKP"
e2e_check "Import BKP: copied" e2e_same_file "$CIFSDRV_RAMFS/node7.img" "$SMB_DIR/backups/node7.img"
e2e_check "Import BKP: trimmed" e2e_out_has 'Found :\ in the file path'
e2e_verify_status "Import BKP" 00

e2e_fresh
e2e_share_put unattend.xml "<unattend/>"
e2e_seed_verbose
e2e_trade Import UnattendOsd unattend.xml
e2e_check_run "Import UnattendOsd"
e2e_check "Import UnattendOsd: copied" e2e_same_file "$CIFSDRV_RAMFS/unattend.xml" "$SMB_DIR/unattend.xml"
e2e_check "Import UnattendOsd: announced" e2e_out_has " entered in to the filesystem "
e2e_verify_status "Import UnattendOsd" 00

# A missing path is EFI_NOT_FOUND, with the source type's own message.
e2e_fresh
e2e_trade Import BKP
e2e_check_run "Import BKP without path"
e2e_check "Import BKP without path: message" e2e_out_has "Backup file is NULL!"
e2e_check "Import BKP without path: exit value 0" test "$E2E_RC" -eq 0
e2e_verify_status "Import BKP without path" 0e

e2e_fresh
e2e_trade Import UnattendOsd
e2e_check_run "Import UnattendOsd without path"
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
