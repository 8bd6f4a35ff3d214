# Functions shared by scripts/quickstart.sh, scripts/quickstop.sh and bench/compare.sh: the
# Release build, the platform file and starting and stopping the three daemons in a scratch
# ORVANE_ROOT. Source it from bash; the caller sets ORVANE_ROOT before starting or stopping.

fi_top=$(cd "$(dirname "${BASH_SOURCE[0]}")/.." && pwd)
fi_bin=$fi_top/build
# The three that index, which fi_start_daemons starts, and every daemon the quick start may run.
fi_indexing_daemons=(quixelasticd fileindexd quixnotifyd)
fi_daemons=("${fi_indexing_daemons[@]}" searchgw)

# fi_become_root SCRIPT [ARGS...]: the library saves its configuration as root, so a script run
# by another user runs itself again through sudo (keeping ORVANE_ROOT and the scripts' own
# COMPARE_* and FILEINDEX_* settings). A root shell needs no
# sudo, which a fresh Debian machine set up with a root password does not have.
fi_become_root() {
  [ "$(id -u)" -eq 0 ] && return 0
  local script=$1
  shift
  if ! command -v sudo >/dev/null 2>&1; then
    echo "$(basename "$script"): run it as root (su -c 'bash $script'): the configuration is" \
      "saved as root, and sudo is not installed" >&2
    exit 1
  fi
  local keep=() name
  for name in $(compgen -e); do
    case $name in ORVANE_ROOT | COMPARE_* | FILEINDEX_*) keep+=("$name=${!name}") ;; esac
  done
  echo "== running $(basename "$script") as root through sudo"
  exec sudo env "${keep[@]}" bash "$script" "$@"
}

# Installs what the build needs and builds the Release binaries into build/.
fi_build() {
  bash "$fi_top/scripts/setup.sh"
  echo "== building"
  cmake -S "$fi_top" -B "$fi_bin" -G Ninja -DCMAKE_BUILD_TYPE=Release -DFILEINDEX_TESTS=OFF \
    -DFILEINDEX_BENCH=OFF >/dev/null
  cmake --build "$fi_bin" -j"$(nproc)" | tail -n 1
}

fi_ctl() { "$fi_bin/tools/fileindexctl/fileindexctl" "$@"; }

fi_run_dir() { echo "$ORVANE_ROOT/var/run"; }
fi_log_dir() { echo "$ORVANE_ROOT/var/log"; }

# Pid of daemon $1 in $ORVANE_ROOT when it is running, nothing otherwise. Only a process of that
# name counts: a pid file left behind may name a pid reused by something else.
fi_daemon_pid() {
  local pidfile pid
  pidfile=$(fi_run_dir)/$1.pid
  [ -f "$pidfile" ] || return 0
  pid=$(cat "$pidfile")
  kill -0 "$pid" 2>/dev/null || return 0
  [ "$(cat "/proc/$pid/comm" 2>/dev/null)" = "$1" ] || return 0
  echo "$pid"
}

# fi_refuse_running NAME: a second set of daemons in the same root would fight over its files.
fi_refuse_running() {
  local d
  for d in "${fi_daemons[@]}"; do
    if [ -n "$(fi_daemon_pid "$d")" ]; then
      echo "$1: $d is already running in $ORVANE_ROOT; stop it with scripts/quickstop.sh" >&2
      exit 1
    fi
  done
}

# fi_write_platform SHARE FOLDER: a platform file whose one share is FOLDER.
fi_write_platform() {
  mkdir -p "$ORVANE_ROOT/etc/orvane"
  cat > "$ORVANE_ROOT/etc/orvane/platform.json" <<JSON
{
  "shares": [{"name": "$1", "path": "$2", "recycle_bin": false}],
  "admin_group": "root"
}
JSON
}

# fi_start_daemons [WRAPPER...]: starts the three daemons in the background with their logs in
# $ORVANE_ROOT/var/log, each under WRAPPER when given (e.g. /usr/bin/time), and waits for the
# sockets of the two that serve requests.
fi_start_daemons() {
  local run logs
  run=$(fi_run_dir)
  logs=$(fi_log_dir)
  mkdir -p "$run" "$logs"
  export FILEINDEX_EXTRACT_HELPER=$fi_bin/extract/fileindex-extract
  "$@" "$fi_bin/daemons/quixelasticd/quixelasticd" --foreground >"$logs/quixelasticd.log" 2>&1 &
  "$@" "$fi_bin/daemons/quixnotifyd/quixnotifyd" >"$logs/quixnotifyd.log" 2>&1 &
  fi_wait_socket "$run/quixelasticd.sock"
  "$@" "$fi_bin/daemons/fileindexd/fileindexd" >"$logs/fileindexd.log" 2>&1 &
  fi_wait_socket "$run/fileindexd.sock"
}

fi_wait_socket() {
  local _
  for _ in $(seq 100); do [ -S "$1" ] && return 0; sleep 0.1; done
  echo "the daemon's socket $1 did not appear within 10 s; see $(fi_log_dir)" >&2
  return 1
}

# Stops the daemons running in $ORVANE_ROOT by their pid files, and nothing else; 1 when one
# is still running after 10 s.
fi_stop_daemons() {
  local status=0 d pidfile pid
  for d in searchgw fileindexd quixnotifyd quixelasticd; do
    pidfile=$(fi_run_dir)/$d.pid
    [ -f "$pidfile" ] || continue
    pid=$(cat "$pidfile")
    if ! kill -0 "$pid" 2>/dev/null; then
      echo "$d: not running"
      continue
    fi
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
  return $status
}
