# shellcheck shell=bash
# Helpers of the firmware tests: disk image, QEMU/OVMF boot, console log
# clean-up, the checks, variables in dmpstore's output and the times at which
# marker lines appear. Sourced by tests/firmware/run-*.sh.

OVMF_CODE=${OVMF_CODE:-/usr/share/OVMF/OVMF_CODE_4M.fd}
OVMF_VARS=${OVMF_VARS:-/usr/share/OVMF/OVMF_VARS_4M.fd}
FW_FAILURES=0
FW_FEEDER_PID=""

fw_die() {
  echo "firmware test: $*" >&2
  exit 1
}

fw_require_tools() {
  local tool
  for tool in qemu-system-x86_64 mformat mcopy timeout; do
    command -v "$tool" >/dev/null || fw_die "$tool not found (run scripts/install-deps.sh)"
  done
  [ -f "$OVMF_CODE" ] || fw_die "no OVMF code image at $OVMF_CODE"
  [ -f "$OVMF_VARS" ] || fw_die "no OVMF variable store template at $OVMF_VARS"
}

# fw_setup NAME IMAGE BUILD_DIR: $EFI is BUILD_DIR/IMAGE (which must exist),
# the tools are there, and $WORK is a fresh work directory.
fw_setup() {
  EFI="$3/$2"
  [ -f "$EFI" ] || fw_die "no image at $EFI (build it first: ninja -C $3)"
  fw_require_tools
  fw_start_work "$1"
}

# fw_finish NAME LOG [LINES]: the verdict; after a failure the work directory
# is kept and the last LINES of LOG are shown.
fw_finish() {
  if [ "$FW_FAILURES" -ne 0 ]; then
    KEEP_WORK=1
    echo "$1 test: $FW_FAILURES check(s) FAILED; console log kept at $2" >&2
    [ -z "${3:-}" ] || tail -n "$3" "$2" | sed 's/^/    | /' >&2
    exit 1
  fi
  echo "$1 test: all checks passed"
}

# Writes standard input to $1 with CR LF line ends, as the shell expects of
# a script.
fw_write_startup() {
  sed 's/$/\r/' >"$1"
}

# Script lines for the network: DHCP, then a bounded wait until the server's
# address answers (QEMU's stack answers the ping itself); %netup% is 1 then.
fw_nsh_network_wait() {
  cat <<'NSH'
ifconfig -s eth0 dhcp
for %i run (1 60)
  if not "%netup%" == "1" then
    ping -n 1 10.0.2.2 > nul
    if %lasterror% == 0 then
      set -v netup 1
    else
      stall 250000
    endif
  endif
endfor
NSH
}

# fw_make_disk IMAGE EFI STARTUP [NAME]: a 16 MiB FAT disk, without partition
# table, holding the image (as NAME, by default CIFSDrv.efi) and the startup
# script in its root.
fw_make_disk() {
  local disk=$1 efi=$2 startup=$3 name=${4:-CIFSDrv.efi}
  rm -f "$disk"
  truncate -s 16M "$disk"
  mformat -i "$disk" -v CIFSBOOT :: || fw_die "mformat failed"
  mcopy -i "$disk" "$efi" "::/$name" || fw_die "mcopy of the image failed"
  mcopy -i "$disk" "$startup" ::/startup.nsh || fw_die "mcopy of startup.nsh failed"
}

# Presses the space bar while the shell counts down before startup.nsh (any
# key but ESC starts the script at once), then keeps the pipe open.
fw_key_feeder() {
  local log=$1 i
  for ((i = 0; i < 600; i++)); do
    if grep -q "any other key" "$log" 2>/dev/null; then
      break
    fi
    sleep 0.1
  done
  for ((i = 0; i < 20; i++)); do
    grep -q "@@BEGIN" "$log" 2>/dev/null && break
    printf ' '
    sleep 0.3
  done
  exec sleep 600
}

# fw_start_work NAME: a fresh work directory in $WORK, removed at exit unless
# KEEP_WORK=1 by then; processes whose ids are in FW_CLEANUP_PIDS are stopped
# at exit as well (with the key feeder).
fw_start_work() {
  WORK=$(mktemp -d "${TMPDIR:-/tmp}/cifsdrv-$1.XXXXXX")
  KEEP_WORK=0
  FW_CLEANUP_PIDS=()
  trap fw_cleanup_work EXIT
}

fw_cleanup_work() {
  local pid
  fw_stop_feeder
  for pid in "${FW_CLEANUP_PIDS[@]}"; do
    kill "$pid" 2>/dev/null || true
    wait "$pid" 2>/dev/null || true
  done
  if [ "$KEEP_WORK" -eq 0 ]; then
    rm -rf "$WORK"
  fi
}

fw_stop_feeder() {
  if [ -n "$FW_FEEDER_PID" ]; then
    kill "$FW_FEEDER_PID" 2>/dev/null || true
    wait "$FW_FEEDER_PID" 2>/dev/null || true
    FW_FEEDER_PID=""
  fi
}

# fw_boot WORK SECONDS: boots OVMF with WORK/disk.img as the first boot
# device and a private copy of the variable store; the serial console goes
# to WORK/serial.log and takes its input from the key feeder. A processor
# exception ends the run at once instead of waiting for the time limit, since
# the firmware halts after reporting one. Returns QEMU's status (124 when the
# time limit ended it). The array FW_QEMU_ARGS, when set, replaces the
# default "-net none" (devices such as a NIC or an RNG; processor model).
fw_boot() {
  local work=$1 limit=$2 rc=0 qemu_pid
  local -a extra=(-net none)
  if [ -n "${FW_QEMU_ARGS+set}" ]; then
    extra=("${FW_QEMU_ARGS[@]}")
  fi
  cp "$OVMF_VARS" "$work/vars.fd"
  rm -f "$work/keys" "$work/serial.log"
  : >"$work/serial.log"
  mkfifo "$work/keys"
  fw_key_feeder "$work/serial.log" >"$work/keys" &
  FW_FEEDER_PID=$!
  timeout --kill-after=5 "$limit" qemu-system-x86_64 \
    -machine q35 -accel tcg -m 256 \
    -drive if=pflash,format=raw,readonly=on,file="$OVMF_CODE" \
    -drive if=pflash,format=raw,file="$work/vars.fd" \
    -drive if=none,id=boot,format=raw,file="$work/disk.img" \
    -device virtio-blk-pci,drive=boot,bootindex=0 \
    -nographic -monitor none \
    -chardev stdio,id=console,signal=off,logfile="$work/serial.log" \
    -serial chardev:console \
    "${extra[@]}" -no-reboot \
    <"$work/keys" >"$work/qemu.out" 2>&1 &
  qemu_pid=$!
  while kill -0 "$qemu_pid" 2>/dev/null; do
    if grep -q "X64 Exception" "$work/serial.log"; then
      sleep 1 # let the register dump reach the log
      echo "firmware test: processor exception, stopping QEMU" >&2
      kill "$qemu_pid" 2>/dev/null || true
      break
    fi
    sleep 0.2
  done
  wait "$qemu_pid" || rc=$?
  fw_stop_feeder
  if [ "$rc" -eq 124 ]; then
    echo "firmware test: QEMU stopped by the ${limit} s time limit" >&2
  fi
  return "$rc"
}

# The serial log as plain text: terminal escape sequences and carriage
# returns removed, trailing blanks trimmed.
fw_clean_log() {
  sed -e 's/\x1b\[[0-9;?=]*[A-Za-z]//g' -e 's/\x1b[()][A-Za-z0-9]//g' -e 's/\x1b[=>]//g' \
    -e 's/\r//g' -e 's/[[:space:]]*$//' "$1"
}

# The lines between "@@BEGIN NAME" and "@@END NAME".
fw_section() {
  sed -n "/^@@BEGIN $2\$/,/^@@END $2\$/p" "$1"
}

fw_pass() { echo "  ok   $*"; }

fw_fail() {
  echo "  FAIL $*" >&2
  FW_FAILURES=$((FW_FAILURES + 1))
}

# fw_check_text TEXT NEEDLE DESCRIPTION
fw_check_text() {
  if grep -qF -- "$2" <<<"$1"; then fw_pass "$3"; else fw_fail "$3 (no \"$2\")"; fi
}

# fw_check_absent_text TEXT NEEDLE DESCRIPTION
fw_check_absent_text() {
  if grep -qF -- "$2" <<<"$1"; then fw_fail "$3 (found \"$2\")"; else fw_pass "$3"; fi
}

# fw_check_contains FILE NEEDLE DESCRIPTION, fw_check_absent FILE NEEDLE
# DESCRIPTION: the same on a file.
fw_check_contains() { fw_check_text "$(<"$1")" "$2" "$3"; }
fw_check_absent() { fw_check_absent_text "$(<"$1")" "$2" "$3"; }

# fw_check_nonzero_lasterror TEXT DESCRIPTION
fw_check_nonzero_lasterror() {
  local value
  value=$(sed -n 's/^LASTERROR=//p' <<<"$1" | head -n 1)
  if [ -z "$value" ]; then
    fw_fail "$2: no LASTERROR line"
  elif [[ "$value" =~ ^(0x)?0+$ ]]; then
    fw_fail "$2: image returned success (LASTERROR=$value)"
  else
    fw_pass "$2: image returned an error (LASTERROR=$value)"
  fi
}

# First data byte, in hex, of the 40-byte outcome variable under
# {4C4AC96B-DD0A-447E-8118-105900DA8629} in dmpstore's output; empty when
# the variable is not there.
fw_verify_status() {
  awk '
    /^Variable / {
      want = (toupper($0) ~ /4C4AC96B-DD0A-447E-8118-105900DA8629:PROVISIONING_ENV_VOLATILE_VAR/ &&
              $0 ~ /DataSize = 0x28/)
      next
    }
    want && /^ *0+: / { print toupper($2); exit }
  ' <<<"$1"
}

# fw_var_hex TEXT GUID NAME: the data of the variable GUID:NAME in dmpstore's
# output, as one lower-case hex string; empty when the variable is not there.
fw_var_hex() {
  awk -v want="$(tr '[:lower:]' '[:upper:]' <<<"$2:$3")" '
    /^Variable / { on = index(toupper($0), want) > 0; next }
    on && /^ *[0-9A-F]+: / {
      line = $0
      sub(/^ *[0-9A-F]+: /, "", line)
      sub(/  \*.*$/, "", line)
      gsub(/[- ]/, "", line)
      printf "%s", tolower(line)
      next
    }
    { on = 0 }
  ' <<<"$1"
}

# fw_hex_text HEX: the text held by the hex bytes, up to the first NUL.
fw_hex_text() {
  local hex=$1 out="" i pair
  for ((i = 0; i + 1 < ${#hex}; i += 2)); do
    pair=${hex:i:2}
    [ "$pair" = 00 ] && break
    out+=$(printf '%b' "\\x$pair")
  done
  printf '%s' "$out"
}
