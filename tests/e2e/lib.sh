# Helpers for the end-to-end scripts: a scratch directory with its own ramfs:
# and variable store, running the hosted program, checks and the summary.
#
#   source lib.sh; e2e_init PATH_TO_CIFSDRV
#   e2e_run ARGS...            -> $E2E_OUT (console text), $E2E_RC (exit code)
#   e2e_check DESCRIPTION CMD... (passes when CMD succeeds)
#   e2e_finish                 -> prints "N passed, M failed", exits non-zero on failure
#
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
