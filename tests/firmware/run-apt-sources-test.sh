#!/usr/bin/env bash
# Checks how scripts/fetch-openssl-src.sh derives its private deb-src list
# from a machine's apt sources, in both formats, on made-up configurations
# (no network, no apt run). The build directory argument that the firmware
# test runner passes is not needed.
#
#   tests/firmware/run-apt-sources-test.sh [BUILD_DIR]
set -euo pipefail

HERE=$(cd "$(dirname "$0")" && pwd)
FETCH="$HERE/../../scripts/fetch-openssl-src.sh"
# shellcheck source=tests/firmware/lib.sh
source "$HERE/lib.sh"

WORK=$(mktemp -d "${TMPDIR:-/tmp}/cifsdrv-apt-sources.XXXXXX")
trap 'rm -rf "$WORK"' EXIT

derive() { bash "$FETCH" --derive-sources "$1" "$2" "$3" 2>"$3.err"; }

# check_same DESCRIPTION EXPECTED_FILE ACTUAL_FILE
check_same() {
  if diff -u "$2" "$3" >"$WORK/diff"; then
    fw_pass "$1"
  else
    fw_fail "$1"
    sed 's/^/    /' "$WORK/diff" >&2
  fi
}

# --- One-line format: sources.list and a .list part ----------------------------
mkdir -p "$WORK/one/parts"
cat >"$WORK/one/sources.list" <<'EOF_LIST'
# deb http://archive.invalid/debian bookworm main
deb http://archive.invalid/debian bookworm main contrib
deb [arch=amd64 signed-by=/usr/share/keyrings/k.gpg] http://archive.invalid/debian-security bookworm-security main
deb-src http://archive.invalid/debian bookworm main
deb http://archive.invalid/debian trixie main
deb http://vendor.invalid/repo nodistro main
   deb	http://archive.invalid/debian	bookworm-updates main
EOF_LIST
echo "deb http://archive.invalid/ports bookworm-backports main" >"$WORK/one/parts/extra.list"
cat >"$WORK/one/expected" <<'EOF_LIST'
deb-src http://archive.invalid/debian bookworm main contrib
deb-src [arch=amd64 signed-by=/usr/share/keyrings/k.gpg] http://archive.invalid/debian-security bookworm-security main
deb-src http://archive.invalid/debian	bookworm-updates main
deb-src http://archive.invalid/ports bookworm-backports main
EOF_LIST
if derive "$WORK/one/sources.list" "$WORK/one/parts" "$WORK/one/out"; then
  check_same "one-line entries of the release become deb-src, others are left out" \
    "$WORK/one/expected" "$WORK/one/out/sources.list"
else
  fw_fail "one-line format: derivation failed: $(cat "$WORK/one/out.err")"
fi

# --- deb822 format ---------------------------------------------------------------
mkdir -p "$WORK/822/parts"
cat >"$WORK/822/parts/debian.sources" <<'EOF_822'
# The archive
Types: deb deb-src
URIs: http://archive.invalid/debian
Suites: bookworm bookworm-updates trixie
Components: main
Signed-By:
 -----BEGIN PGP PUBLIC KEY BLOCK-----
 .
 mQINBGPL0BUBEADmW5NlOp1
 -----END PGP PUBLIC KEY BLOCK-----

Types: deb
URIs: http://archive.invalid/debian-security
Suites: bookworm-security
Enabled: no
Components: main

Types: deb-src
URIs: http://archive.invalid/debian
Suites: bookworm
Components: main

Types: deb
# a comment inside a stanza
URIs: http://archive.invalid/debian-security
Suites: bookworm-security
Components: main
EOF_822
cat >"$WORK/822/parts/vendor.sources" <<'EOF_822'
Types: deb
URIs: http://vendor.invalid/repo
Suites: nodistro
Components: main
EOF_822
cat >"$WORK/822/expected" <<'EOF_822'
Types: deb-src
URIs: http://archive.invalid/debian
Suites: bookworm bookworm-updates
Components: main
Signed-By:
 -----BEGIN PGP PUBLIC KEY BLOCK-----
 .
 mQINBGPL0BUBEADmW5NlOp1
 -----END PGP PUBLIC KEY BLOCK-----

Types: deb-src
URIs: http://archive.invalid/debian-security
Suites: bookworm-security
Components: main

EOF_822
if derive "$WORK/822/none.list" "$WORK/822/parts" "$WORK/822/out"; then
  # The parts are read in name order: debian.sources is the first.
  check_same "deb822 stanzas: enabled deb entries of the release, key block kept" \
    "$WORK/822/expected" "$WORK/822/out/sources.list.d/archive-1.sources"
  if [ -s "$WORK/822/out/sources.list.d/archive-2.sources" ]; then
    fw_fail "deb822: a source without the release's suites was kept"
  else
    fw_pass "deb822: a source without the release's suites is left out"
  fi
else
  fw_fail "deb822 format: derivation failed: $(cat "$WORK/822/out.err")"
fi

# --- Nothing usable ----------------------------------------------------------------
mkdir -p "$WORK/none/parts"
cp "$WORK/822/parts/vendor.sources" "$WORK/none/parts/"
if derive "$WORK/none/missing.list" "$WORK/none/parts" "$WORK/none/out"; then
  fw_fail "no archive of the release: the derivation should fail"
else
  fw_check_contains "$WORK/none/out.err" "no Debian bookworm archive entry found" \
    "no archive of the release: a clear failure"
fi

if [ "$FW_FAILURES" -ne 0 ]; then
  echo "apt sources test: $FW_FAILURES check(s) FAILED" >&2
  exit 1
fi
echo "apt sources test: all checks passed"
