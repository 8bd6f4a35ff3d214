#!/usr/bin/env bash
# Stops the daemons that scripts/quickstart.sh started in $ORVANE_ROOT (default
# /tmp/fileindex-quickstart), by the pid files they wrote there, and nothing else.
set -uo pipefail
root=${ORVANE_ROOT:-/tmp/fileindex-quickstart}
status=0
for d in fileindexd quixnotifyd quixelasticd; do
  pidfile=$root/var/run/$d.pid
  [ -f "$pidfile" ] || continue
  pid=$(cat "$pidfile")
  if ! kill -0 "$pid" 2>/dev/null; then
    echo "$d: not running"
    continue
  fi
  # Only a process of that name is ours to stop; a reused pid is left alone.
  if [ "$(cat "/proc/$pid/comm" 2>/dev/null)" != "$d" ]; then
    echo "$d: pid $pid is not $d any more, left alone"
    continue
  fi
  kill -TERM "$pid"
  for _ in $(seq 100); do kill -0 "$pid" 2>/dev/null || break; sleep 0.1; done
  if kill -0 "$pid" 2>/dev/null; then
    echo "$d: still running after 10 s (pid $pid)"
    status=1
  else
    echo "$d: stopped"
  fi
done
exit $status
