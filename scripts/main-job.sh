#!/usr/bin/env bash
# The main job on a fresh Debian 12 machine: installs what is needed, builds
# the hosted program, starts a Samba share on loopback holding a sample update
# catalog, and runs the catalog action against it:
#
#   cifsdrv G <share> 127.0.0.1 <user> <password>
#
# It then shows where the catalog landed in ramfs: and what the outcome
# variable says. Everything lives under build/demo/.
#
#   BUILD_DIR  build directory of the hosted program (build/host)
#   JOBS       parallel build jobs (ninja's default)
set -euo pipefail
cd "$(dirname "$0")/.."
ROOT=$(pwd)
BUILD_DIR=${BUILD_DIR:-build/host}

bash scripts/install-deps.sh >/dev/null

cmake -S . -B "$BUILD_DIR" -G Ninja -DCIFSDRV_PLATFORM=Host >/dev/null
ninja -C "$BUILD_DIR" ${JOBS:+-j"$JOBS"} cifsdrv >/dev/null

DEMO="$ROOT/build/demo"
export SMB_SHARE=${SMB_SHARE:-provisioning}
export SMB_USER=${SMB_USER:-cifsuser}
export SMB_PASS=${SMB_PASS:-Cifs-Pass1}
export SMB_DIR="$DEMO/share"
rm -rf "$DEMO"
mkdir -p "$SMB_DIR/catalog" "$DEMO/ramfs"

# A small sample catalog in the share's "catalog" directory.
cat >"$DEMO/catalog.xml" <<'XML'
<?xml version="1.0" encoding="utf-8"?>
<Manifest version="1.0" dateTime="2026-11-01T00:00:00">
  <SoftwareComponent path="firmware/BIOS_1.2.3.bin" packageType="BIOS" vendorVersion="1.2.3">
    <Name>System firmware</Name>
  </SoftwareComponent>
  <SoftwareComponent path="firmware/NIC_22.5.bin" packageType="NIC" vendorVersion="22.5">
    <Name>Network adapter firmware</Name>
  </SoftwareComponent>
</Manifest>
XML
gzip -9 -c "$DEMO/catalog.xml" >"$SMB_DIR/catalog/catalog.xml.gz"
chmod -R a+rwX "$SMB_DIR"

bash scripts/samba-test-server.sh start

# The text-field record "PUPROVISIONING_ENV_VAR" belongs to other firmware
# components, which create it; the catalog action only writes the catalog's
# directory into it. Start the demo with an empty one, so that the directory
# is remembered.
printf '{4D4AC77B-DD0A-447E-8117-104901DA8679} PUPROVISIONING_ENV_VAR 3 %s\n' \
  "$(head -c 1152 /dev/zero | od -An -tx1 -v | tr -d ' \n')" >"$DEMO/vars.txt"

echo "== Running: cifsdrv G $SMB_SHARE 127.0.0.1 $SMB_USER ********"
set +e
CIFSDRV_RAMFS="$DEMO/ramfs" CIFSDRV_VARSTORE="$DEMO/vars.txt" \
  "$ROOT/$BUILD_DIR/cifsdrv" G "$SMB_SHARE" 127.0.0.1 "$SMB_USER" "$SMB_PASS" | tee "$DEMO/console.txt"
rc=${PIPESTATUS[0]}
set -e

echo
echo "== Exit value: $rc"
echo "== ramfs: (backed by $DEMO/ramfs)"
ls -l "$DEMO/ramfs"
if [ -f "$DEMO/ramfs/catalog.xml.gz" ]; then
  if cmp -s "$DEMO/ramfs/catalog.xml.gz" "$SMB_DIR/catalog/catalog.xml.gz"; then
    echo "The catalog landed in ramfs:\\catalog.xml.gz, byte-identical to the share's copy."
  else
    echo "ramfs:\\catalog.xml.gz differs from the share's copy!"
  fi
fi
echo "== Outcome variable (from $DEMO/vars.txt)"
bash scripts/show-outcome.sh "$DEMO/vars.txt"
