#!/usr/bin/env bash
# Connect time against the local Samba test server: a mount-only run of the
# hosted program (cifsdrv m: connect to tree connect, volume install, shell
# mapping, unmount), as a median of 20 whole runs, next to
# `smbclient -m SMB2_10 -c exit` for the same share in the same run.
#
#   scripts/bench-connect.sh [build-dir]
#
# Builds the hosted program without sanitizers (default build/bench, release
# flags). Starts and stops the Samba server.
set -euo pipefail
cd "$(dirname "$0")/.."
BUILD=${1:-build/bench}
ROUNDS=20
export SMB_USER=cifstest SMB_PASS=Cifs-Test-Pw1 SMB_SHARE=cifsshare

cmake -S . -B "$BUILD" -G Ninja -DCIFSDRV_PLATFORM=Host -DCIFSDRV_SANITIZE=OFF \
  -DCMAKE_BUILD_TYPE=Release >/dev/null
ninja -C "$BUILD" -j"${JOBS:-2}" cifsdrv >/dev/null
bash scripts/samba-test-server.sh start
trap 'bash scripts/samba-test-server.sh stop; rm -rf "$WORK"' EXIT
WORK=$(mktemp -d)
export CIFSDRV_RAMFS=$WORK/ramfs CIFSDRV_VARSTORE=$WORK/vars.txt

# time_runs LABEL COMMAND...: the median of ROUNDS runs in milliseconds.
time_runs() {
  local label=$1 start end
  shift
  for _ in $(seq "$ROUNDS"); do
    start=$(date +%s%N)
    "$@" >"$WORK/out.txt" 2>&1 || { cat "$WORK/out.txt"; exit 1; }
    end=$(date +%s%N)
    echo $(((end - start) / 1000))
  done | sort -n | awk -v l="$label" -v n="$ROUNDS" '{ v[NR] = $1 }
    END { printf "%s, median of %d: %.2f ms\n", l, n, (v[int((n + 1) / 2)] + v[int(n / 2) + 1]) / 2000 }'
}

time_runs "cifsdrv m (whole process)" "$BUILD/cifsdrv" m "$SMB_SHARE" 127.0.0.1 Export VML \
  "$SMB_USER" "$SMB_PASS"
time_runs "smbclient -m SMB2_10 -c exit (whole process)" smbclient -m SMB2_10 \
  "//127.0.0.1/$SMB_SHARE" -U "$SMB_USER%$SMB_PASS" -c exit
