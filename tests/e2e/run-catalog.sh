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

# G with a directory (its trailing "\" dropped): the catalog lands in
# ramfs:, the directory and the kind are remembered.
e2e_fresh
e2e_share_put updates/v2/catalog.xml.gz "gz in a given directory"
e2e_seed_text_fields
e2e_cifsdrv G 'updates\v2\'
e2e_check_run "G"
e2e_check "G: exit value 0" test "$E2E_RC" -eq 0
e2e_verify_status "G" 00
e2e_check "G: in ramfs:" e2e_same_file "$CIFSDRV_RAMFS/catalog.xml.gz" "$SMB_DIR/updates/v2/catalog.xml.gz"
e2e_check "G: directory remembered" test "$(e2e_text_field 384)" = 'CIFS:\updates\v2'
e2e_check "G: kind 2" test "$(e2e_catalog_kind)" = 2

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
