#!/usr/bin/env bash
# Prints the outcome recorded by a run: the provisioning variables found in a
# hosted variable store file ({GUID} Name ATTRIBUTES_HEX DATA_HEX per line).
set -euo pipefail
store=${1:-cifsdrv-vars.txt}

# Hex bytes to text, up to the first NUL.
hex_to_text() {
  local hex=$1 out="" i pair
  for ((i = 0; i < ${#hex}; i += 2)); do
    pair=${hex:i:2}
    [ "$pair" = "00" ] && break
    out+=$(printf '%b' "\\x$pair")
  done
  printf '%s' "$out"
}
[ -f "$store" ] || { echo "no variable store at $store"; exit 1; }
while read -r guid name attrs data; do
  case "$guid" in '#'*|'') continue ;; esac
  case "$name" in
    PROVISIONING_ENV_VOLATILE_VAR)
      # First field: the 64-bit status of the last operation, little-endian.
      le=${data:0:16}
      be=""
      for ((i = 14; i >= 0; i -= 2)); do be+=${le:i:2}; done
      printf '%s %s: status 0x%s (VerifyStatus = %d)\n' "$guid" "$name" "$be" "$((16#${le:0:2}))"
      ;;
    CATALOGFILE_ENV_VAR)
      le=${data:0:8}
      printf '%s %s: catalog kind %d\n' "$guid" "$name" "$((16#${le:6:2}${le:4:2}${le:2:2}${le:0:2}))"
      ;;
    PUPROVISIONING_ENV_VAR)
      # Text fields at 0, 128, ..., 768 (128 bytes) and 896 (256 bytes).
      for off in 0 128 256 384 512 640 768 896; do
        hex=${data:off*2:256}
        text=$(hex_to_text "$hex")
        [ -n "$text" ] && printf '%s %s: field at %d = "%s"\n' "$guid" "$name" "$off" "$text"
      done
      ;;
    *) printf '%s %s: attributes 0x%s, %d bytes\n' "$guid" "$name" "$attrs" "$(( ${#data} / 2 ))" ;;
  esac
done <"$store"
