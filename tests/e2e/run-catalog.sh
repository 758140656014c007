#!/usr/bin/env bash
# Action G (catalog retrieval) and action S (signature copy) against a Samba
# share on loopback: where the catalog is looked for, which kind wins, what
# lands in ramfs: and what the provisioning variables remember.
#
# Usage: run-catalog.sh PATH_TO_CIFSDRV
set -u
E2E_HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$E2E_HERE/lib.sh"
source "$E2E_HERE/../support/e2e-share.sh"
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
e2e_share_put catalog.xml.gz "gz in the root"
e2e_share_put catalog/catalog.xml.gz "gz under catalog"
e2e_seed_text_fields
e2e_cifsdrv G
check_catalog "share root" "CIFS:" 2 catalog.xml.gz catalog.xml.gz
e2e_check "share root: announced" e2e_out_has "found catalog location is CIFS:\\catalog.xml.gz"

e2e_fresh
e2e_share_put catalog/catalog.xml "plain under catalog"
e2e_share_put repository/catalog.xml.gz "gz under repository"
e2e_seed_text_fields
e2e_cifsdrv G
check_catalog "catalog directory" 'CIFS:\catalog' 1 catalog.xml catalog/catalog.xml
e2e_check "catalog directory: repository not copied" test ! -e "$CIFSDRV_RAMFS/catalog.xml.gz"

e2e_fresh
e2e_share_put repository/catalog.xml.gz "gz under repository"
e2e_seed_text_fields
e2e_cifsdrv G
check_catalog "repository only" 'CIFS:\repository' 2 catalog.xml.gz repository/catalog.xml.gz
e2e_check "repository only: root tried first" e2e_out_has "catalogFilePath = CIFS:\\catalog.xml.gz"
e2e_check "repository only: catalog tried second" \
  e2e_out_has "catalogFilePath = CIFS:\\catalog\\catalog.xml"

e2e_fresh
e2e_share_put updates/v2/catalog.xml.gz "gz in a given directory"
e2e_seed_text_fields
e2e_cifsdrv G 'updates\v2\'
check_catalog "given directory" 'CIFS:\updates\v2' 2 catalog.xml.gz updates/v2/catalog.xml.gz
e2e_check "given directory: separator removed" \
  e2e_out_has "catalogFilePath = CIFS:\\updates\\v2\\catalog.xml.gz"

e2e_fresh
e2e_share_put catalog/catalog.xml "plain"
e2e_share_put catalog/catalog.xml.gz "compressed"
e2e_seed_text_fields
e2e_cifsdrv G
check_catalog "both kinds" 'CIFS:\catalog' 2 catalog.xml.gz catalog/catalog.xml.gz
e2e_check "both kinds: plain one not copied" test ! -e "$CIFSDRV_RAMFS/catalog.xml"

e2e_fresh
e2e_share_put other/catalog.xml.gz
e2e_seed_text_fields 'CIFS:\earlier'
e2e_cifsdrv G
e2e_check_run "none present"
e2e_check "none present: exit value 0" test "$E2E_RC" -eq 0
e2e_verify_status "none present" 0e
e2e_check "none present: kind 0" test "$(e2e_catalog_kind)" = 0
e2e_check "none present: directory kept" test "$(e2e_text_field 384)" = 'CIFS:\earlier'
e2e_check "none present: nothing copied" test -z "$(ls -A "$CIFSDRV_RAMFS")"

# 130 characters in three levels: a listing ends at names longer than 127
# characters, so one name could not hold them.
part=$(printf 'd%.0s' $(seq 40))
last=$(printf 'e%.0s' $(seq 48))
long="$part\\$part\\$last"
e2e_fresh
e2e_share_put "$part/$part/$last/catalog.xml.gz" "gz in a long directory"
e2e_seed_text_fields 'CIFS:\earlier'
e2e_cifsdrv G "$long"
e2e_check_run "130 characters"
e2e_check "130 characters: the directory has 130 characters" test "${#long}" -eq 130
e2e_verify_status "130 characters" 00
e2e_check "130 characters: copied" \
  e2e_same_file "$CIFSDRV_RAMFS/catalog.xml.gz" "$SMB_DIR/$part/$part/$last/catalog.xml.gz"
e2e_check "130 characters: warning" \
  e2e_out_has "Warning: CIFS catalog path too long. Unable to persist to the PU Env. Variable"
e2e_check "130 characters: not persisted" test "$(e2e_text_field 384)" = 'CIFS:\earlier'
e2e_check "130 characters: kind 2" test "$(e2e_catalog_kind)" = 2

# Without the text-field record the catalog is still fetched.
e2e_fresh
e2e_share_put catalog.xml "plain"
e2e_cifsdrv G
e2e_check_run "no text-field record"
e2e_verify_status "no text-field record" 00
e2e_check "no text-field record: reported" e2e_out_has "Error retrieving PU Environment Variable"
e2e_check "no text-field record: copied" e2e_same_file "$CIFSDRV_RAMFS/catalog.xml" "$SMB_DIR/catalog.xml"

# Action S: the signature from the remembered directory.
e2e_fresh
e2e_share_put repository/catalog.xml.gz.sign "signature"
e2e_seed_text_fields 'CIFS:\repository'
e2e_cifsdrv S
e2e_check_run "signature"
e2e_verify_status "signature" 00
e2e_check "signature: copied" \
  e2e_same_file "$CIFSDRV_RAMFS/catalog.xml.gz.sign" "$SMB_DIR/repository/catalog.xml.gz.sign"

e2e_fresh
e2e_share_put catalog.xml.gz.sign "signature"
e2e_cifsdrv S
e2e_check_run "signature without record"
e2e_check "signature without record: exit value 0" test "$E2E_RC" -eq 0
e2e_verify_status "signature without record" 00
e2e_check "signature without record: nothing copied" test -z "$(ls -A "$CIFSDRV_RAMFS")"

# G then S in two runs: the second finds what the first remembered.
e2e_fresh
e2e_share_put catalog/catalog.xml.gz "gz"
e2e_share_put catalog/catalog.xml.gz.sign "its signature"
e2e_seed_text_fields
e2e_cifsdrv G
e2e_check_run "G before S"
e2e_cifsdrv S
e2e_check_run "G then S"
e2e_verify_status "G then S" 00
e2e_check "G then S: signature copied" \
  e2e_same_file "$CIFSDRV_RAMFS/catalog.xml.gz.sign" "$SMB_DIR/catalog/catalog.xml.gz.sign"

e2e_finish
