#!/usr/bin/env bash
# Fetches Debian 12's OpenSSL source package and prepares the few headers the
# firmware image needs from it (MD4, MD5, SHA-256 and RC4 are compiled from
# these sources into the image; nothing prebuilt is ever linked).
#
#   scripts/fetch-openssl-src.sh [DEST]      (default: build/openssl-src)
#   scripts/fetch-openssl-src.sh --derive-sources SOURCE_LIST SOURCE_PARTS OUT_DIR
#       (only writes the derived sources of OUT_DIR, as below, and exits)
#
# Afterwards DEST/src is the unpacked source tree, configured for the UEFI
# target without assembler, threads, sockets or stdio, with its generated
# headers in place. A second run with the same pinned version returns at once.
#
# apt runs with a private configuration under DEST/apt: its own sources list,
# package lists and cache, so the machine's apt state is neither used nor
# changed. The sources list is derived from the machine's configured Debian
# archive (one-line and deb822 formats) by turning its "deb" entries for the
# bookworm suites into "deb-src" entries; no mirror host is named here.
# Works without a terminal and with CI=true; installs dpkg-dev (needed by
# apt-get source to unpack) when it is missing and we are root.
set -euo pipefail

# The exact source version of openssl in Debian 12 (bookworm) that the image
# is built from. A point release of Debian that replaces it makes the fetch
# fail loudly; moving the pin is then a deliberate change.
readonly OPENSSL_SRC_VERSION="3.0.20-1~deb12u2"
readonly RELEASE="bookworm"

say() { echo "fetch-openssl-src: $*" >&2; }
die() {
  say "$*"
  exit 1
}

# --- The private apt configuration -------------------------------------------
# One-line entries: "deb [options] URI SUITE COMPONENT..." become deb-src.
convert_one_line() {
  awk -v release="$RELEASE" '
    /^[ \t]*deb[ \t]/ {
      line = $0
      sub(/^[ \t]*deb[ \t]+/, "", line)
      options = ""
      if (line ~ /^\[/) {
        options = substr(line, 1, index(line, "]"))
        line = substr(line, index(line, "]") + 1)
        sub(/^[ \t]+/, "", line)
      }
      n = split(line, word, /[ \t]+/)
      if (n >= 2 && (word[2] == release || index(word[2], release "-") == 1)) {
        printf "deb-src %s%s%s\n", options, (options == "" ? "" : " "), line
      }
    }' "$1"
}

# deb822 stanzas: those whose Types include deb, not disabled, keep their
# fields with Types set to deb-src and Suites cut down to the release's.
convert_deb822() {
  awk -v release="$RELEASE" '
    function reset() { n = 0; isdeb = 0; enabled = 1; suites = ""; keep = 1 }
    function flush(  i) {
      if (n > 0 && isdeb && enabled && suites != "") {
        for (i = 1; i <= n; i++) print text[i]
        print ""
      }
      reset()
    }
    BEGIN { reset() }
    /^#/ { next }
    /^[ \t]*$/ { flush(); next }
    /^[ \t]/ { if (keep) text[++n] = $0; next }
    {
      colon = index($0, ":")
      field = tolower(substr($0, 1, colon - 1))
      value = substr($0, colon + 1)
      keep = 1
      if (field == "types") {
        m = split(value, t, /[ \t]+/)
        for (i = 1; i <= m; i++) if (t[i] == "deb") isdeb = 1
        text[++n] = "Types: deb-src"
        next
      }
      if (field == "suites") {
        m = split(value, s, /[ \t]+/)
        for (i = 1; i <= m; i++)
          if (s[i] == release || index(s[i], release "-") == 1) suites = suites " " s[i]
        text[++n] = "Suites:" suites
        next
      }
      if (field == "enabled" && tolower(value) ~ /no/) enabled = 0
      text[++n] = $0
    }
    END { flush() }' "$1"
}

# derive_sources SOURCE_LIST SOURCE_PARTS OUT_DIR: OUT_DIR/sources.list and
# OUT_DIR/sources.list.d/ from the machine's apt sources; fails when no
# entry for the release is found.
derive_sources() {
  local list=$1 parts=$2 out=$3 file part=0
  mkdir -p "$out/sources.list.d"
  : >"$out/sources.list"
  if [ -f "$list" ]; then
    convert_one_line "$list" >>"$out/sources.list"
  fi
  for file in "${parts%/}"/*.list; do
    if [ -f "$file" ]; then
      convert_one_line "$file" >>"$out/sources.list"
    fi
  done
  for file in "${parts%/}"/*.sources; do
    [ -f "$file" ] || continue
    part=$((part + 1))
    convert_deb822 "$file" >"$out/sources.list.d/archive-$part.sources"
  done
  if ! grep -qs . "$out/sources.list" "$out"/sources.list.d/*.sources; then
    die "no Debian $RELEASE archive entry found in the machine's apt sources"
  fi
}

if [ "${1:-}" = --derive-sources ]; then
  [ "$#" -eq 4 ] || die "usage: $0 --derive-sources SOURCE_LIST SOURCE_PARTS OUT_DIR"
  derive_sources "$2" "$3" "$4"
  exit 0
fi

ROOT=$(cd "$(dirname "$0")/.." && pwd)
DEST=${1:-$ROOT/build/openssl-src}
mkdir -p "$DEST"
DEST=$(cd "$DEST" && pwd)
STAMP="$DEST/.prepared"

ready() { [ -f "$STAMP" ] && [ "$(cat "$STAMP")" = "$OPENSSL_SRC_VERSION" ] && [ -d "$DEST/src" ]; }

if ready; then
  exit 0
fi

# Several build directories may configure at the same time.
exec 9>"$DEST/.lock"
flock 9
if ready; then
  exit 0
fi

for tool in apt-get apt-config perl make flock; do
  command -v "$tool" >/dev/null || die "$tool not found (run scripts/install-deps.sh)"
done

APT_DIR="$DEST/apt"
rm -rf "$APT_DIR"
mkdir -p "$APT_DIR/lists/partial" "$APT_DIR/cache/archives/partial"
eval "$(apt-config shell SOURCE_LIST Dir::Etc::sourcelist/f SOURCE_PARTS Dir::Etc::sourceparts/d)"
derive_sources "${SOURCE_LIST:-/nonexistent}" "${SOURCE_PARTS:-/nonexistent}" "$APT_DIR"

APT_OPTS=(
  -o "Dir::Etc::SourceList=$APT_DIR/sources.list"
  -o "Dir::Etc::SourceParts=$APT_DIR/sources.list.d"
  -o "Dir::State::Lists=$APT_DIR/lists"
  -o "Dir::Cache=$APT_DIR/cache"
  -o "Acquire::Languages=none"
  -o "APT::Sandbox::User=$(id -un)"
  -o "Dpkg::Use-Pty=0"
  -q
)

# --- dpkg-source, which apt-get source unpacks with -------------------------
if ! command -v dpkg-source >/dev/null; then
  [ "$(id -u)" -eq 0 ] || die "dpkg-source is missing; install dpkg-dev (as root: apt-get install dpkg-dev)"
  say "installing dpkg-dev"
  DEBIAN_FRONTEND=noninteractive apt-get install -y --no-install-recommends dpkg-dev </dev/null ||
    { apt-get update </dev/null && DEBIAN_FRONTEND=noninteractive \
      apt-get install -y --no-install-recommends dpkg-dev </dev/null; }
fi

# --- Fetch and unpack ---------------------------------------------------------
say "fetching openssl/$RELEASE (pinned $OPENSSL_SRC_VERSION) with a private apt configuration"
apt-get "${APT_OPTS[@]}" update </dev/null >"$APT_DIR/update.log" 2>&1 ||
  { cat "$APT_DIR/update.log" >&2; die "apt-get update failed"; }

WORK="$DEST/download"
rm -rf "$WORK" "$DEST/src"
mkdir -p "$WORK"
(cd "$WORK" && apt-get "${APT_OPTS[@]}" source "openssl/$RELEASE" </dev/null >"$APT_DIR/source.log" 2>&1) ||
  { cat "$APT_DIR/source.log" >&2; die "apt-get source openssl/$RELEASE failed"; }

dsc=$(find "$WORK" -maxdepth 1 -name 'openssl_*.dsc' | head -n 1)
[ -n "$dsc" ] || die "no openssl .dsc was downloaded"
got=$(sed -n 's/^Version: //p' "$dsc" | head -n 1)
if [ "$got" != "$OPENSSL_SRC_VERSION" ]; then
  die "$RELEASE now offers openssl $got, but the image is pinned to $OPENSSL_SRC_VERSION; check the new version and update OPENSSL_SRC_VERSION in $0"
fi
tree=$(find "$WORK" -mindepth 1 -maxdepth 1 -type d -name 'openssl-*' | head -n 1)
if [ -z "$tree" ] || [ ! -f "$tree/Configure" ]; then
  die "the unpacked source tree has no Configure"
fi
mv "$tree" "$DEST/src"

# --- Configure for the UEFI target and generate the headers -----------------
# Only the generated headers are made (a few seconds of perl); the library
# itself is never built.
say "configuring for UEFI-x86_64"
(
  cd "$DEST/src"
  perl ./Configure UEFI-x86_64 no-asm no-shared no-threads no-sock no-stdio no-ui-console \
    no-afalgeng no-dso no-engine no-async no-tests >"$APT_DIR/configure.log" 2>&1 ||
    { cat "$APT_DIR/configure.log" >&2; exit 1; }
  make build_generated >>"$APT_DIR/configure.log" 2>&1 ||
    { cat "$APT_DIR/configure.log" >&2; exit 1; }
) || die "configuring the OpenSSL sources failed"

# The package lists and the downloaded archives are no longer needed.
rm -rf "$WORK" "$APT_DIR/lists" "$APT_DIR/cache"
echo "$OPENSSL_SRC_VERSION" >"$STAMP"
say "ready: $DEST/src"
