# shellcheck shell=bash disable=SC2034 # E2E_RC and the GUIDs are the scripts'
# Helpers for the end-to-end scripts (source lib.sh; e2e_init PATH_TO_CIFSDRV):
# a scratch directory with its own ramfs: and variable store, the Samba share
# (e2e_share_start, e2e_fresh, e2e_share_put, e2e_ramfs_put), runs of the
# hosted program (e2e_cifsdrv, e2e_trade, e2e_run: $E2E_OUT and $E2E_RC),
# checks (e2e_check DESCRIPTION CMD..., e2e_check_run, e2e_verify_status), the
# provisioning variables, and the summary (e2e_finish: "N passed, M failed").
# With CIFSDRV_CONSOLE_LOG set, every run's arguments and console text are
# appended to that file (for comparing consoles across changes).

E2E_PASSED=0
E2E_FAILED=0

e2e_init() {
  E2E_BIN=$(readlink -f "$1")
  if [[ ! -x "$E2E_BIN" ]]; then
    echo "e2e: program not found: $1" >&2
    exit 2
  fi
  E2E_DIR=$(mktemp -d /tmp/cifsdrv-e2e.XXXXXX)
  trap 'rm -rf "$E2E_DIR"' EXIT
  export CIFSDRV_VARSTORE="$E2E_DIR/vars.txt"
  export CIFSDRV_RAMFS="$E2E_DIR/ramfs"
  cd "$E2E_DIR" || exit 2
}

# Starts every run from an empty variable store.
e2e_reset_vars() {
  rm -f "$CIFSDRV_VARSTORE"
}

e2e_run() {
  E2E_OUT=$(timeout 60 "$E2E_BIN" "$@" 2>&1)
  E2E_RC=$?
  if [[ -n "${CIFSDRV_CONSOLE_LOG:-}" ]]; then
    printf '### %s %s\n%s\n' "$(basename "$0")" "$*" "$E2E_OUT" >>"$CIFSDRV_CONSOLE_LOG"
  fi
}

e2e_check() {
  local description=$1
  shift
  if "$@"; then
    E2E_PASSED=$((E2E_PASSED + 1))
  else
    E2E_FAILED=$((E2E_FAILED + 1))
    echo "FAIL: $description"
  fi
}

# The console text of the last run holds TEXT (fixed string).
e2e_out_has() {
  [[ "$E2E_OUT" == *"$1"* ]]
}

e2e_out_lacks() {
  [[ "$E2E_OUT" != *"$1"* ]]
}

# Prints "ATTRIBUTES DATA" of a variable in the store, nothing when absent.
e2e_var() {
  local guid=$1 name=$2
  [[ -f "$CIFSDRV_VARSTORE" ]] || return 0
  awk -v g="{$guid}" -v n="$name" '$1 == g && $2 == n { print $3, $4 }' "$CIFSDRV_VARSTORE"
}

# The variable's data starts with the hex bytes PREFIX.
e2e_var_starts() {
  local value
  value=$(e2e_var "$1" "$2")
  [[ "${value#* }" == "$3"* ]]
}

e2e_finish() {
  echo "$E2E_PASSED passed, $E2E_FAILED failed"
  [[ "$E2E_FAILED" == 0 ]]
  exit $?
}

E2E_REPO=$(cd "$(dirname "${BASH_SOURCE[0]}")/../.." && pwd)

export SMB_USER=cifstest
export SMB_PASS=Cifs-Test-Pw1
export SMB_SHARE=cifsshare
export SMB_DIR=${SMB_STATE_DIR:-/tmp/cifsdrv-samba}/share-e2e

readonly PROVISIONING_GUID=4C4AC96B-DD0A-447E-8118-105900DA8629
readonly PU_GUID=4D4AC77B-DD0A-447E-8117-104901DA8679
readonly CATALOG_GUID=806E07A4-AE56-11E1-A464-FE1F6188709B
readonly DEBUG_GUID=47C7B224-C42A-11D2-8E57-00A0C969723B

# Another test's server may hold the port for a while: wait up to a minute.
e2e_share_start() {
  local attempt
  for attempt in $(seq 30); do
    if bash "$E2E_REPO/scripts/samba-test-server.sh" start 2>/dev/null; then
      break
    fi
    if [[ "$attempt" == 30 ]]; then
      echo "e2e: the Samba test server could not be started"
      exit 2
    fi
    sleep 2
  done
  trap 'cd /; rm -rf "$E2E_DIR"; bash "$E2E_REPO/scripts/samba-test-server.sh" stop' EXIT
}

e2e_fresh() {
  rm -rf "$SMB_DIR" "$CIFSDRV_RAMFS"
  mkdir -p "$SMB_DIR" "$CIFSDRV_RAMFS"
  chown "$SMB_USER" "$SMB_DIR"
  chmod 0777 "$SMB_DIR"
  e2e_reset_vars
}

e2e_share_put() {
  mkdir -p "$(dirname "$SMB_DIR/$1")"
  printf '%s' "${2:-content of $1}" >"$SMB_DIR/$1"
  chmod -R a+rwX "$SMB_DIR"
}

e2e_ramfs_put() {
  mkdir -p "$(dirname "$CIFSDRV_RAMFS/$1")"
  printf '%s' "${2:-content of $1}" >"$CIFSDRV_RAMFS/$1"
}

# Standard layout: cifsdrv ACTION SHARE 127.0.0.1 USER PASSWORD [PATH].
e2e_cifsdrv() {
  local action=$1
  shift
  e2e_run "$action" "$SMB_SHARE" 127.0.0.1 "$SMB_USER" "$SMB_PASS" "$@"
}

# Trade layout: cifsdrv e SHARE 127.0.0.1 TRADE SOURCE USER PASSWORD [FILE].
e2e_trade() {
  local trade=$1 source=$2
  shift 2
  e2e_run e "$SMB_SHARE" 127.0.0.1 "$trade" "$source" "$SMB_USER" "$SMB_PASS" "$@"
}

e2e_check_run() {
  e2e_check "$1: no pool block or socket left" e2e_out_lacks "cifsdrv: left behind:"
  e2e_check "$1: no sanitizer report" e2e_out_lacks "runtime error"
  e2e_check "$1: no AddressSanitizer report" e2e_out_lacks "AddressSanitizer"
}

e2e_verify_status() {
  e2e_check "$1: VerifyStatus $2" e2e_var_starts "$PROVISIONING_GUID" PROVISIONING_ENV_VOLATILE_VAR "$2"
}

# Hex of TEXT padded with zero bytes to SIZE bytes.
e2e_hex_field() {
  local text=$1 size=$2 hex
  hex=$(printf '%s' "$text" | od -An -tx1 -v | tr -d ' \n')
  printf '%s' "$hex"
  printf '%0*d' $((size * 2 - ${#hex})) 0
}

# Writes the text-field record with the CIFS catalog directory PATH.
e2e_seed_text_fields() {
  local data
  data="$(e2e_hex_field "" 384)$(e2e_hex_field "${1:-}" 128)$(e2e_hex_field "" 640)"
  echo "{$PU_GUID} PUPROVISIONING_ENV_VAR 3 $data" >>"$CIFSDRV_VARSTORE"
}

e2e_text_field() {
  local value hex out="" i pair
  value=$(e2e_var "$PU_GUID" PUPROVISIONING_ENV_VAR)
  hex=${value#* }
  hex=${hex:$(($1 * 2)):256}
  for ((i = 0; i < ${#hex}; i += 2)); do
    pair=${hex:i:2}
    [[ "$pair" == "00" ]] && break
    out+=$(printf '%b' "\\x$pair")
  done
  printf '%s' "$out"
}

e2e_catalog_kind() {
  local value le
  value=$(e2e_var "$CATALOG_GUID" CATALOGFILE_ENV_VAR)
  le=${value#* }
  printf '%d' "$((16#${le:6:2}${le:4:2}${le:2:2}${le:0:2}))"
}

e2e_same_file() {
  cmp -s "$1" "$2"
}
