#!/usr/bin/env bash
# Action G (catalog retrieval) and action S (signature copy) against a Samba
# share on loopback: the catalog lands in ramfs:, its directory and kind are
# remembered, and S copies the signature from the remembered directory.
# (Where the catalog is looked for and which kind wins: TasksTest.)
#
# Usage: run-catalog.sh PATH_TO_CIFSDRV
set -u
E2E_HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$E2E_HERE/lib.sh"
e2e_init "${1:?usage: run-catalog.sh PATH_TO_CIFSDRV}"
e2e_share_start

# check_catalog NAME PERSISTED KIND FILE SOURCE: the catalog FILE in ramfs:
# equals the share's SOURCE, the directory and kind are remembered.
check_catalog() {
  local name=$1 persisted=$2 kind=$3 file=$4 source=$5
  e2e_check_run "$name"
  e2e_check "$name: exit value 0" test "$E2E_RC" -eq 0
  e2e_verify_status "$name" 00
  e2e_check "$name: $file in ramfs:" e2e_same_file "$CIFSDRV_RAMFS/$file" "$SMB_DIR/$source"
  e2e_check "$name: directory remembered" test "$(e2e_text_field 384)" = "$persisted"
  e2e_check "$name: kind $kind" test "$(e2e_catalog_kind)" = "$kind"
}

e2e_fresh
e2e_share_put catalog/catalog.xml "plain under catalog"
e2e_share_put repository/catalog.xml.gz "gz under repository"
e2e_seed_text_fields
e2e_cifsdrv G
check_catalog "G" 'CIFS:\catalog' 1 catalog.xml catalog/catalog.xml

e2e_fresh
e2e_share_put updates/v2/catalog.xml.gz "gz in a given directory"
e2e_seed_text_fields
e2e_cifsdrv G 'updates\v2\'
check_catalog "G with a directory" 'CIFS:\updates\v2' 2 catalog.xml.gz updates/v2/catalog.xml.gz

# G then S in two runs: the second finds what the first remembered.
e2e_fresh
e2e_share_put catalog/catalog.xml.gz "gz"
e2e_share_put catalog/catalog.xml.gz.sign "its signature"
e2e_seed_text_fields
e2e_cifsdrv G
e2e_cifsdrv S
e2e_check_run "G then S"
e2e_verify_status "G then S" 00
e2e_check "G then S: signature copied" \
  e2e_same_file "$CIFSDRV_RAMFS/catalog.xml.gz.sign" "$SMB_DIR/catalog/catalog.xml.gz.sign"

e2e_fresh
e2e_share_put catalog.xml.gz.sign "signature"
e2e_cifsdrv S
e2e_check_run "S without record"
e2e_verify_status "S without record" 00
e2e_check "S without record: nothing copied" test -z "$(ls -A "$CIFSDRV_RAMFS")"

e2e_finish
