#!/usr/bin/env bash
# SMB2 signing against Samba on loopback. With "server signing = mandatory"
# the actions m, G, I and "e ... Export VML" complete byte-identical, and a
# capture shows SMB2_FLAGS_SIGNED on every request after the session setup
# and no malformed packet. Against the default server nothing is signed,
# unless the SMB2Signing variable asks for it; then everything is, and the
# run still succeeds.
#
# Usage: run-signing.sh PATH_TO_CIFSDRV
set -u
E2E_HERE=$(cd "$(dirname "${BASH_SOURCE[0]}")" && pwd)
source "$E2E_HERE/lib.sh"
e2e_init "${1:?usage: run-signing.sh PATH_TO_CIFSDRV}"
command -v tshark >/dev/null || { echo "e2e: tshark not found (scripts/install-deps.sh)"; exit 2; }

# capture NAME CMD...: runs CMD while tshark records port 445 on loopback.
capture() {
  local pcap="$E2E_DIR/$1.pcap" pid
  shift
  tshark -i lo -f "tcp port 445" -w "$pcap" -q >/dev/null 2>&1 &
  pid=$!
  for _ in $(seq 50); do [[ -s "$pcap" ]] && break; sleep 0.1; done
  "$@"
  sleep 0.5
  kill "$pid" 2>/dev/null
  wait "$pid" 2>/dev/null
}

# Requests after the session setup in a capture, counted by their signed
# flag: "signed unsigned".
signed_requests() {
  tshark -r "$E2E_DIR/$1.pcap" -Y 'smb2.flags.response == 0 && smb2.cmd > 1' \
    -T fields -e smb2.flags.signature 2>/dev/null |
    tr ',' '\n' | awk '$1 == 1 { s++ } $1 == 0 { u++ } END { printf "%d %d", s, u }'
}

malformed() {
  tshark -r "$E2E_DIR/$1.pcap" -Y '_ws.malformed || _ws.expert.severity == error' 2>/dev/null |
    wc -l
}

seed_signing_variable() {
  echo "{$DEBUG_GUID} SMB2Signing 7 31" >>"$CIFSDRV_VARSTORE"
}

the_actions() {
  e2e_run m "$SMB_SHARE" 127.0.0.1 Export VML "$SMB_USER" "$SMB_PASS"
  e2e_verify_status "mandatory m" 00
  e2e_cifsdrv G
  e2e_verify_status "mandatory G" 00
  e2e_cifsdrv I big.bin
  e2e_verify_status "mandatory I" 00
  e2e_trade Export VML exports
  e2e_check_run "mandatory e Export VML"
  e2e_verify_status "mandatory e Export VML" 00
}

export SMB_SIGNING=mandatory
e2e_share_start
e2e_fresh
mkdir -p "$SMB_DIR/exports"
head -c 300000 /dev/urandom >"$SMB_DIR/catalog.xml.gz"
head -c 1048576 /dev/urandom >"$SMB_DIR/big.bin"
chmod -R a+rwX "$SMB_DIR"
head -c 200000 /dev/urandom >"$CIFSDRV_RAMFS/VelmorLog.xml"
capture mandatory the_actions
e2e_check "mandatory: catalog identical" e2e_same_file "$CIFSDRV_RAMFS/catalog.xml.gz" "$SMB_DIR/catalog.xml.gz"
e2e_check "mandatory: import identical" e2e_same_file "$CIFSDRV_RAMFS/big.bin" "$SMB_DIR/big.bin"
e2e_check "mandatory: export identical" e2e_same_file "$CIFSDRV_RAMFS/VelmorLog.xml" "$SMB_DIR"/exports/*_VelmorLog_*.xml
read -r signed unsigned <<<"$(signed_requests mandatory)"
e2e_check "mandatory: $signed requests signed, $unsigned not" test "$signed" -gt 0 -a "$unsigned" -eq 0
e2e_check "mandatory: no malformed packet" test "$(malformed mandatory)" -eq 0

# The default server: nothing signed, unless the variable asks.
export SMB_SIGNING=
e2e_share_start
e2e_reset_vars
capture default e2e_cifsdrv G
e2e_verify_status "default G" 00
read -r signed unsigned <<<"$(signed_requests default)"
e2e_check "default: $unsigned requests, none signed" test "$signed" -eq 0 -a "$unsigned" -gt 0
e2e_reset_vars
seed_signing_variable
capture variable e2e_cifsdrv G
e2e_verify_status "variable G" 00
e2e_check "variable: catalog identical" e2e_same_file "$CIFSDRV_RAMFS/catalog.xml.gz" "$SMB_DIR/catalog.xml.gz"
read -r signed unsigned <<<"$(signed_requests variable)"
e2e_check "variable: $signed requests signed, $unsigned not" test "$signed" -gt 0 -a "$unsigned" -eq 0
e2e_check "variable: no malformed packet" test "$(malformed variable)" -eq 0

e2e_finish
