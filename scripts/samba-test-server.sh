#!/usr/bin/env bash
# A self-contained Samba file server on loopback for the SMB2 tests.
#
#   samba-test-server.sh start|stop|status|restart
#
# Everything lives under one state directory (default /tmp/cifsdrv-samba):
# its own smb.conf, private, lock, state, cache, pid and ncalrpc directories
# and the log. smbd runs as a daemon (no systemd), bound to loopback only, on
# port 445. "start" is idempotent: a running server with the same
# configuration is left alone, one with a different configuration is
# restarted. "stop" ends only the processes whose pid files are in the state
# directory.
#
# Settings (environment):
#   SMB_STATE_DIR   state directory              (/tmp/cifsdrv-samba)
#   SMB_MIN_PROTO   server min protocol          (SMB2_02)
#   SMB_MAX_PROTO   server max protocol          (SMB2_10)
#   SMB_USER        Unix and Samba user          (cifstest)
#   SMB_PASS        its password                 (Cifs-Test-Pw1)
#   SMB_SHARE       share name                   (cifsshare)
#   SMB_DIR         shared directory             ($SMB_STATE_DIR/share)
#   SMB_WORKGROUP   workgroup                    (CIFSTEST)
#   SMB_SIGNING     server signing: mandatory, auto or disabled (unset or
#                   empty: no such line, Samba's default). "mandatory" makes
#                   the server refuse unsigned SMB2 requests after the session
#                   setup; for SMB2, Samba treats "disabled" as "auto" (the
#                   client may sign, nothing requires it).
set -euo pipefail

STATE_DIR=${SMB_STATE_DIR:-/tmp/cifsdrv-samba}
MIN_PROTO=${SMB_MIN_PROTO:-SMB2_02}
MAX_PROTO=${SMB_MAX_PROTO:-SMB2_10}
SMB_USER=${SMB_USER:-cifstest}
SMB_PASS=${SMB_PASS:-Cifs-Test-Pw1}
SMB_SHARE=${SMB_SHARE:-cifsshare}
SMB_DIR=${SMB_DIR:-$STATE_DIR/share}
WORKGROUP=${SMB_WORKGROUP:-CIFSTEST}
SIGNING=${SMB_SIGNING:-}

CONF=$STATE_DIR/smb.conf
PID_DIR=$STATE_DIR/pid
START_TIMEOUT=${SMB_START_TIMEOUT:-15}

log() { echo "samba-test-server: $*" >&2; }

need_tools() {
  local missing=()
  command -v smbd >/dev/null || missing+=(samba)
  command -v smbpasswd >/dev/null || missing+=(samba-common-bin)
  if [ ${#missing[@]} -gt 0 ]; then
    log "installing ${missing[*]}"
    DEBIAN_FRONTEND=noninteractive apt-get install -y "${missing[@]}" >/dev/null
  fi
}

# The configuration file. "server signing" appears only when SMB_SIGNING is
# set, so that without it the file is Samba's default as before.
render_conf() {
  cat <<EOF
[global]
  workgroup = $WORKGROUP
  netbios name = CIFSTESTSRV
  server role = standalone server
  server string = cifsdrv test server
  interfaces = lo 127.0.0.1/8 ::1/128
  bind interfaces only = yes
  disable netbios = yes
  smb ports = 445
  server min protocol = $MIN_PROTO
  server max protocol = $MAX_PROTO${SIGNING:+
  server signing = $SIGNING}
  passdb backend = tdbsam
  private dir = $STATE_DIR/private
  lock directory = $STATE_DIR/lock
  state directory = $STATE_DIR/state
  cache directory = $STATE_DIR/cache
  pid directory = $PID_DIR
  ncalrpc dir = $STATE_DIR/ncalrpc
  log file = $STATE_DIR/log/smbd.log
  max log size = 1000
  log level = 1
  load printers = no
  printing = bsd
  printcap name = /dev/null
  disable spoolss = yes
  map to guest = never
  host msdfs = no

[$SMB_SHARE]
  path = $SMB_DIR
  read only = no
  browseable = yes
  force user = $SMB_USER
  valid users = $SMB_USER
EOF
}

# A process that exists and has not exited; an exited daemon can linger as
# a zombie when nothing reaps it, and that counts as gone.
alive() {
  local state
  state=$(awk '{print $3}' "/proc/$1/stat" 2>/dev/null) || return 1
  [ -n "$state" ] && [ "$state" != Z ] && [ "$state" != X ]
}

# Pids recorded in the state directory's pid files that are still alive.
our_pids() {
  local f pid
  [ -d "$PID_DIR" ] || return 0
  for f in "$PID_DIR"/*.pid; do
    [ -e "$f" ] || continue
    pid=$(tr -dc '0-9' <"$f")
    if [ -n "$pid" ] && alive "$pid"; then
      echo "$pid"
    fi
  done
  return 0
}

is_running() { [ -n "$(our_pids)" ]; }

port_answers() {
  (exec 3<>/dev/tcp/127.0.0.1/445) 2>/dev/null
}

do_stop() {
  local pids
  pids=$(our_pids)
  if [ -z "$pids" ]; then
    return 0
  fi
  # shellcheck disable=SC2086
  kill -TERM $pids 2>/dev/null || true
  for _ in $(seq 1 100); do
    [ -z "$(our_pids)" ] && break
    sleep 0.05
  done
  pids=$(our_pids)
  if [ -n "$pids" ]; then
    # shellcheck disable=SC2086
    kill -KILL $pids 2>/dev/null || true
  fi
  rm -f "$PID_DIR"/*.pid
  # Children of the daemon end with it; wait (bounded) until the port is free.
  for _ in $(seq 1 100); do
    port_answers || break
    sleep 0.05
  done
}

ensure_user() {
  if ! id -u "$SMB_USER" >/dev/null 2>&1; then
    useradd -M -s /usr/sbin/nologin "$SMB_USER"
  fi
  printf '%s\n%s\n' "$SMB_PASS" "$SMB_PASS" | smbpasswd -c "$CONF" -s -a "$SMB_USER" >/dev/null
}

do_start() {
  case "$SIGNING" in
  "" | mandatory | auto | disabled) ;;
  *)
    log "SMB_SIGNING must be mandatory, auto, disabled or empty, not '$SIGNING'"
    exit 2
    ;;
  esac
  need_tools
  mkdir -p "$STATE_DIR"/{private,lock,state,cache,pid,ncalrpc,log}
  chmod 700 "$STATE_DIR/private"
  local wanted
  wanted=$(render_conf)
  if is_running && [ -f "$CONF" ] && [ "$(cat "$CONF")" = "$wanted" ] &&
    [ -f "$STATE_DIR/credentials" ] && [ "$(cat "$STATE_DIR/credentials")" = "$SMB_USER:$SMB_PASS" ] &&
    port_answers; then
    return 0
  fi
  do_stop
  printf '%s\n' "$wanted" >"$CONF"
  mkdir -p "$SMB_DIR"
  ensure_user
  printf '%s\n' "$SMB_USER:$SMB_PASS" >"$STATE_DIR/credentials"
  chmod 600 "$STATE_DIR/credentials"
  chown "$SMB_USER" "$SMB_DIR"
  chmod 0775 "$SMB_DIR"
  if port_answers; then
    log "port 445 on 127.0.0.1 is taken by another process"
    exit 1
  fi
  smbd -D -s "$CONF"
  local deadline=$((SECONDS + START_TIMEOUT))
  until port_answers; do
    if [ $SECONDS -ge $deadline ]; then
      log "smbd did not answer on port 445 within ${START_TIMEOUT}s; log follows"
      tail -n 30 "$STATE_DIR/log/smbd.log" >&2 || true
      do_stop
      exit 1
    fi
    sleep 0.05
  done
}

case "${1:-}" in
start) do_start ;;
stop) do_stop ;;
restart)
  do_stop
  do_start
  ;;
status)
  if is_running; then
    echo "running (pids $(our_pids | tr '\n' ' '))"
  else
    echo "stopped"
    exit 3
  fi
  ;;
*)
  echo "usage: $0 start|stop|status|restart" >&2
  exit 2
  ;;
esac
