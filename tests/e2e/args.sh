#!/usr/bin/env bash
# The hosted program's command line: refused argument counts, and a valid
# command line whose mount fails (no credentials, no server) but that still
# creates the provisioning variables and records its outcome.
#
# Usage: args.sh PATH_TO_CIFSDRV
set -u
source "$(dirname "${BASH_SOURCE[0]}")/lib.sh"
e2e_init "${1:?usage: args.sh PATH_TO_CIFSDRV}"

readonly PROVISIONING_GUID=4C4AC96B-DD0A-447E-8118-105900DA8629
readonly STARTUP_GUID=7AEEC9D6-45E8-4CDB-8EF1-3099A6002371

# Each argument is listed twice in a row; argument 0 is the program itself.
check_argument_dump() {
  local index=0 arg
  for arg in "$E2E_BIN" "$@"; do
    e2e_check "argv[$index] printed twice" e2e_line_count "argv[$index] = $arg" 2
    index=$((index + 1))
  done
}

check_refused() {
  local count=$(($# + 1))
  e2e_reset_vars
  e2e_run "$@"
  e2e_check "$count arguments: mismatch message" \
    e2e_out_has "Mismatch in number of parameters passed! Min. = 4, Max = 9, Actual = $count"
  check_argument_dump "$@"
  e2e_check "$count arguments: non-zero exit" test "$E2E_RC" -ne 0
  e2e_check "$count arguments: no start-up" e2e_out_lacks "Entering into IPMI Library"
  e2e_check "$count arguments: outcome recorded" \
    e2e_var_starts "$PROVISIONING_GUID" PROVISIONING_ENV_VOLATILE_VAR 03
}

check_refused a b
check_refused G share 127.0.0.1 user pw file 7 8 9

e2e_reset_vars
e2e_run m share 127.0.0.1 Export VML
e2e_check "mount: start-up ran" e2e_out_has " Entering into IPMI Library "
e2e_check "mount: reported by main" e2e_out_has "Mount partition failed!"
e2e_check "mount: the unmount decides the exit value" test "$E2E_RC" -eq 0
e2e_check "settings record: 396 bytes, attributes 3" \
  e2e_var_shape "$PROVISIONING_GUID" PROVISIONING_ENV_VAR 3 396
e2e_check "outcome record at start-up: 40 bytes, attributes 2" \
  e2e_var_shape "$STARTUP_GUID" PROVISIONING_ENV_VOLATILE_VAR 2 40
e2e_check "outcome record of main: 40 bytes, attributes 2" \
  e2e_var_shape "$PROVISIONING_GUID" PROVISIONING_ENV_VOLATILE_VAR 2 40
e2e_check "outcome: the mount's error byte" \
  e2e_var_first_byte_nonzero "$PROVISIONING_GUID" PROVISIONING_ENV_VOLATILE_VAR

# A second run finds everything in place.
e2e_run m share 127.0.0.1 Export VML
e2e_check "second run: settings kept" e2e_out_has "PROVISIONING_ENV_VAR already initialized"
e2e_check "second run: outcome kept" \
  e2e_out_has "PROVISIONING_ENV_VOLATILE_VAR already initialized"

e2e_finish
