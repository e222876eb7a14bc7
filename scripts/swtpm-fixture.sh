#!/usr/bin/env bash
# Starts or stops the swtpm that the test suite shares.
#   swtpm-fixture.sh start|stop swtpm:path=SOCKET
# The state lives beside the socket and is made fresh on every start.
set -euo pipefail
action=$1
tcti=$2
sock=${tcti#swtpm:path=}
[ "$sock" != "$tcti" ] || { echo "expected swtpm:path=SOCKET, got $tcti" >&2; exit 1; }
dir=$(dirname "$sock")
state=$dir/swtpm-state
pidfile=$dir/swtpm.pid

stop_running() {
  if [ -f "$pidfile" ]; then
    pid=$(cat "$pidfile")
    if kill -0 "$pid" 2>/dev/null; then
      # A clean shutdown first, so that the TPM does not count it as a power loss.
      tpm2_shutdown -T "$tcti" >/dev/null 2>&1 || true
      kill "$pid" 2>/dev/null || true
      for _ in $(seq 50); do kill -0 "$pid" 2>/dev/null || break; sleep 0.1; done
      kill -9 "$pid" 2>/dev/null || true
    fi
    rm -f "$pidfile"
  fi
  rm -f "$sock" "$sock.ctrl"
}

case "$action" in
  start)
    stop_running
    rm -rf "$state"
    mkdir -p "$state"
    swtpm socket --tpm2 \
      --server type=unixio,path="$sock" \
      --ctrl type=unixio,path="$sock.ctrl" \
      --tpmstate dir="$state" \
      --flags not-need-init,startup-clear \
      --pid file="$pidfile" \
      --log file="$dir/swtpm.log" \
      --daemon
    for _ in $(seq 100); do
      if tpm2_getcap properties-fixed -T "$tcti" >/dev/null 2>&1; then
        echo "swtpm answers at $sock"
        exit 0
      fi
      sleep 0.1
    done
    echo "swtpm did not answer at $sock" >&2
    exit 1
    ;;
  stop)
    stop_running
    echo "swtpm stopped"
    ;;
  *)
    echo "usage: $0 start|stop swtpm:path=SOCKET" >&2
    exit 2
    ;;
esac
