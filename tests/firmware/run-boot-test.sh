#!/usr/bin/env bash
# Boots CIFSDrv.efi in QEMU/OVMF and checks what it prints on the console.
#
#   tests/firmware/run-boot-test.sh BUILD_DIR   (the directory holding CIFSDrv.efi)
#
# A FAT disk (built with mtools, nothing is mounted) carries the image and a
# startup.nsh that the firmware's shell runs: the image with too few and a
# valid number of arguments, each followed by %lasterror%, once
# more with debug levels stored in firmware variables, then a dump of the
# outcome variable, then "reset -s" so that QEMU exits. There is no network
# (-net none): the runs with valid arguments must fail their mount honestly.
#
# Exit status 0 when every check passes; otherwise the failed checks and the
# path of the kept console log are printed.
set -euo pipefail

BUILD_DIR=${1:?usage: $0 BUILD_DIR}
HERE=$(cd "$(dirname "$0")" && pwd)
# shellcheck source=tests/firmware/lib.sh
source "$HERE/lib.sh"

fw_setup boot CIFSDrv.efi "$BUILD_DIR"


# The runs. Each run's console output is framed by markers so that the
# checks below look only at their own run.
fw_write_startup "$WORK/startup.nsh" <<'NSH'
@echo -off
fs0:
echo "@@BEGIN few"
fs0:\CIFSDrv.efi a b
echo "LASTERROR=%lasterror%"
echo "@@END few"
echo "@@BEGIN valid"
fs0:\CIFSDrv.efi m share 127.0.0.1 Export VML
echo "LASTERROR=%lasterror%"
echo "@@END valid"
echo "@@BEGIN levels"
setvar QVUIkestDebugLevel -guid 47C7B224-C42A-11D2-8E57-00A0C969723B -bs ="2"
setvar SMB2DebugLevel -guid 47C7B224-C42A-11D2-8E57-00A0C969723B -bs ="9"
fs0:\CIFSDrv.efi m share 127.0.0.1 Export VML
echo "LASTERROR=%lasterror%"
echo "@@END levels"
echo "@@BEGIN vars"
dmpstore -guid 4C4AC96B-DD0A-447E-8118-105900DA8629 PROVISIONING_ENV_VOLATILE_VAR
echo "@@END vars"
echo "@@DONE"
reset -s
NSH

fw_make_disk "$WORK/disk.img" "$EFI" "$WORK/startup.nsh"
started=$(date +%s)
fw_boot "$WORK" 100 || true
echo "boot test: QEMU ran $(($(date +%s) - started)) s"

LOG="$WORK/console.txt"
fw_clean_log "$WORK/serial.log" >"$LOG"

# --- Checks -------------------------------------------------------------------
fw_check_contains "$LOG" "@@DONE" "the startup script ran to its end (the image returned every time)"
fw_check_absent "$LOG" "X64 Exception" "no processor exception"

few=$(fw_section "$LOG" few)
fw_check_text "$few" "Mismatch in number of parameters passed! Min. = 4, Max = 9, Actual = 3" \
  "3 arguments: count mismatch reported"
# The shell hands over argument 0 with the mapping name in capitals.
fw_check_text "$few" 'argv[0] = FS0:\CIFSDrv.efi' "3 arguments: argument 0 as the shell hands it over"
fw_check_nonzero_lasterror "$few" "3 arguments"

valid=$(fw_section "$LOG" valid)
fw_check_absent_text "$valid" "Mismatch in number of parameters" "6 arguments: no count mismatch"
# (Trailing blanks are trimmed from the log lines.)
fw_check_text "$valid" " Entering into IPMI Library" "6 arguments: start-up initialisation entered"
fw_check_text "$valid" "Debug level is set to 0" "6 arguments: driver level read (variable absent)"
fw_check_text "$valid" "SMB2 Debug level is set to 0" "6 arguments: SMB2 level read"
fw_check_text "$valid" "Mount partition failed!" "6 arguments: the mount fails honestly"
# The exit value reflects the unmount, which succeeds with nothing mounted.
fw_check_text "$valid" "LASTERROR=0x0" "6 arguments: image returned EFI_SUCCESS"

# Debug levels stored in firmware variables: the driver level is taken as
# given, the SMB2 level clamped to its highest value; level 2 shows trace
# lines but no longer the level-5 detail that follows the level read.
levels=$(fw_section "$LOG" levels)
fw_check_text "$levels" "Debug level is set to 2" "debug variables: driver level 2 read"
fw_check_text "$levels" "SMB2 Debug level is set to 6" "debug variables: SMB2 level 9 clamped to 6"
fw_check_text "$levels" "Entering UnmountStaticFileSystem" "debug variables: level 2 shows trace lines"
after_level=$(sed -n '/Debug level is set to 2/,$p' <<<"$levels")
fw_check_absent_text "$after_level" "Getting var.VerifyStatus" \
  "debug variables: level 2 hides level-5 detail"

vars=$(fw_section "$LOG" vars)
verify=$(fw_verify_status "$vars")
if [ -z "$verify" ]; then
  fw_fail "outcome variable {4C4AC96B-...}:PROVISIONING_ENV_VOLATILE_VAR (40 bytes) not found"
elif [ "$verify" = "00" ]; then
  fw_fail "outcome variable records success (VerifyStatus 0) although the mount failed"
else
  fw_pass "outcome variable records the failed mount (VerifyStatus 0x$verify)"
fi

fw_finish boot "$LOG" 40
