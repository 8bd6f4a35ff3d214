#!/usr/bin/env bash
# package_test.sh BUILD_DIR SOURCE_DIR: packages the programs built in BUILD_DIR with the
# project's debian/ folder, checks the package against the install rules and the units, runs
# lintian and systemd-analyze on it, then unpacks it into a scratch root and runs the daemons
# from there as their units would: index a share, stop everything, start it again.
set -euo pipefail
build=$(realpath "$1")
src=$(realpath "$2")
here=$(dirname "$(realpath "$0")")
work=$(mktemp -d /tmp/fileindex-package-test.XXXXXX)
pids=()
cleanup() {
  local pid
  for pid in "${pids[@]}"; do kill -KILL "$pid" 2>/dev/null || true; done
  rm -rf "$work"
}
trap cleanup EXIT
fail() { echo "FAIL: $*" >&2; exit 1; }
step() { echo "== $*"; }

step "building the package from $build"
mkdir -p "$work/src"
cp -r "$src/debian" "$work/src/"
(cd "$work/src" && FILEINDEX_PREBUILT=$build dpkg-buildpackage -b -us -uc -nc -d \
  >"$work/build.log" 2>&1) || { tail -n 40 "$work/build.log"; fail "dpkg-buildpackage failed"; }
deb=$(ls "$work"/fileindex_*.deb)

step "contents against the install rules"
dpkg-deb --fsys-tarfile "$deb" | tar -t | sed 's|^\./|/|; s|/$||' | sort >"$work/in-package"
(cd "$work/src/debian/tmp" && find . ! -type d | sed 's|^\.||' | sort) >"$work/installed"
# Manual pages are compressed on the way in.
missing=$(comm -23 "$work/installed" <(sed 's|^\(/usr/share/man/.*\)\.gz$|\1|' "$work/in-package" | sort))
[ -z "$missing" ] || fail "installed by the rules but not packaged: $missing"
expected=(
  /usr/sbin/quixelasticd /usr/sbin/fileindexd /usr/sbin/quixnotifyd /usr/sbin/searchgw
  /usr/sbin/webd /usr/share/fileindex/www/index.html /etc/pam.d/fileindex-web
  /usr/bin/fileindexctl /usr/libexec/fileindex/fileindex-extract
  /usr/libexec/fileindex/quixzrmnotify /usr/lib/fileindex/libfileindex.so
  /etc/default/fileindex /etc/orvane/fileindex.conf /usr/lib/sysctl.d/60-fileindex.conf
  /usr/share/bash-completion/completions/fileindexctl
  /usr/share/fileindex/spotlight_mappings.json
  /usr/share/man/man1/fileindexctl.1.gz /usr/share/man/man8/quixelasticd.8.gz
  /usr/share/man/man8/fileindexd.8.gz /usr/share/man/man8/quixnotifyd.8.gz
  /usr/share/man/man8/searchgw.8.gz /usr/share/man/man8/webd.8.gz
)
units=(quixelasticd quixnotifyd fileindexd searchgw webd)
for u in "${units[@]}"; do expected+=("/lib/systemd/system/$u.service"); done
for f in "${expected[@]}"; do grep -qx "$f" "$work/in-package" || fail "$f is not in the package"; done
dpkg-deb -e "$deb" "$work/control"
for f in /etc/default/fileindex /etc/orvane/fileindex.conf /etc/pam.d/fileindex-web; do
  grep -qx "$f" "$work/control/conffiles" || fail "$f is no conffile"
done
depends=$(dpkg-deb -f "$deb" Depends)
for lib in adduser libjsoncpp libsqlite3 libsystemd0 libseccomp2 libpoppler-cpp; do
  [[ $depends == *"$lib"* ]] || fail "Depends lacks $lib: $depends"
done
grep -q "adduser --system --group" "$work/control/postinst" || fail "postinst creates no user"
grep -q "deb-systemd-helper" "$work/control/postinst" || fail "postinst does not enable the units"

step "unpacking into a scratch root"
root=$work/root
dpkg-deb -x "$deb" "$root"
for u in "${units[@]}"; do
  exec_start=$(sed -n 's/^ExecStart=\([^ ]*\).*/\1/p' "$root/lib/systemd/system/$u.service")
  [ -x "$root$exec_start" ] || fail "$u.service starts $exec_start, which the package lacks"
done
ldd "$root/usr/sbin/fileindexd" "$root/usr/libexec/fileindex/fileindex-extract" \
  | grep -q "not found" && fail "a program does not find its libraries in the unpacked root"

step "shell completion"
complete_words() {
  PATH=$root/usr/bin:$PATH bash -c '
    source /usr/share/bash-completion/bash_completion
    source "$1/usr/share/bash-completion/completions/fileindexctl"
    shift; COMP_WORDS=("$@"); COMP_CWORD=$(($# - 1)); COMP_LINE="$*"; COMP_POINT=${#COMP_LINE}
    _fileindexctl; echo "${COMPREPLY[*]}"' _ "$root" "$@"
}
[[ " $(complete_words fileindexctl fol) " == *" folder "* ]] || fail "no completion of fol"
[[ " $(complete_words fileindexctl folder a) " == *" add "* ]] || fail "no completion of folder a"
[[ " $(complete_words fileindexctl folder add /x --doc) " == *" --document "* ]] \
  || fail "no completion of folder add --doc: $(complete_words fileindexctl folder add /x --doc)"

step "lintian"
lintian --fail-on error --tag-display-limit 0 "$deb" | tee "$work/lintian.txt" \
  || fail "lintian found errors"
echo "lintian: $(grep -c '^E:' "$work/lintian.txt" || true) errors, $(grep -c '^W:' "$work/lintian.txt" || true) warnings"

step "systemd-analyze"
for u in "${units[@]}"; do
  # Verified against this machine's units; the daemon itself is in the unpacked root (checked
  # above), not necessarily installed here.
  systemd-analyze verify --man=no "$root/lib/systemd/system/$u.service" 2>&1 \
    | grep -v "Command /usr/sbin/$u is not executable" | tee "$work/verify.txt" || true
  [ ! -s "$work/verify.txt" ] || fail "$u.service does not verify"
  # The exposure score of each unit; above 5.0 ("MEDIUM") fails.
  systemd-analyze security --offline=yes --root="$root" --threshold=50 "$u.service" \
    >"$work/security.txt" 2>&1 || { tail -n 3 "$work/security.txt"; fail "$u.service is too exposed"; }
  echo "$u.service: $(grep -o 'Overall exposure level.*' "$work/security.txt")"
done

if [ "$(id -u)" -ne 0 ]; then
  echo "not root: the daemons are not started (the library saves its configuration as root)"
  exit 0
fi

step "the daemons from the unpacked root, started as the units start them"
export ORVANE_ROOT=$root
unset FILEINDEX_EXTRACT_HELPER
share=$work/volume/docs
mkdir -p "$share/reports" "$root/etc/orvane" "$root/var/log"
echo "the quarterly zanzibarite figures" >"$share/reports/q3.txt"
cat >"$root/etc/orvane/platform.json" <<JSON
{"shares": [{"name": "docs", "path": "$share", "recycle_bin": false}], "admin_group": "root"}
JSON
free_port() {
  python3 -c 'import socket; s = socket.socket(); s.bind(("127.0.0.1", 0)); print(s.getsockname()[1])'
}
# What an administrator would put in the options file: free ports, and for the web page the
# unpacked root's files in place of the installed ones.
port=$(free_port)
web_port=$(free_port)
sed -i -e "s|^SEARCHGW_OPTS=.*|SEARCHGW_OPTS=\"--port $port\"|" \
  -e "s|^WEBD_OPTS=.*|WEBD_OPTS=\"--port $web_port --www $root/usr/share/fileindex/www --pam-dir $root/etc/pam.d\"|" \
  "$root/etc/default/fileindex"

# unit_command UNIT: its ExecStart line with the options file's variables put in, as systemd
# does (EnvironmentFile=, then $VAR split on white space), and the unpacked root before it.
unit_command() {
  (
    set -a
    # shellcheck disable=SC1091
    source "$root/etc/default/fileindex"
    line=$(sed -n 's/^ExecStart=//p' "$root/lib/systemd/system/$1.service")
    eval "set -- $line"
    echo "$root$1" "${@:2}"
  )
}
declare -A address=(
  [quixelasticd]=$root/var/run/quixelasticd.sock [quixnotifyd]=-
  [fileindexd]=$root/var/run/fileindexd.sock [searchgw]=127.0.0.1:$port
  [webd]=127.0.0.1:$web_port
)
start_all() {
  local u cmd pid
  pids=()
  for u in quixelasticd quixnotifyd fileindexd searchgw webd; do  # the units' order
    read -r -a cmd <<<"$(unit_command "$u")"
    pid=$(python3 "$here/start_ready.py" "$root/var/log/$u.log" "${address[$u]}" "${cmd[@]}") \
      || { cat "$root/var/log/$u.log"; fail "$u did not start as its unit does"; }
    pids+=("$pid")
  done
}
stop_all() {
  local pid
  for pid in "${pids[@]}"; do
    kill -TERM "$pid"
    for _ in $(seq 300); do kill -0 "$pid" 2>/dev/null || break; sleep 0.1; done
    kill -0 "$pid" 2>/dev/null && fail "pid $pid did not stop within 30 s of SIGTERM"
  done
  pids=()
}
ctl() { "$root/usr/bin/fileindexctl" "$@"; }
found() { ctl --json search "$1" | grep -q "$2"; }

start_all
ctl folder add "$share" --document on >/dev/null
ctl status --wait --timeout 120 >/dev/null
found zanzibarite reports/q3.txt || fail "the indexed file is not found: $(ctl search zanzibarite)"

step "stop everything, change the share, start everything"
stop_all
echo "notes on quokkas" >"$share/reports/while-stopped.txt"
start_all
ctl status --wait --timeout 120 >/dev/null
found zanzibarite reports/q3.txt || fail "the index did not survive the restart"
# The watcher queues its reconciliation once its watches are in place, which can be after the
# indexer last said it was idle: give it the time a reconciliation of this small share takes.
for _ in $(seq 120); do found quokkas while-stopped.txt && break; sleep 0.5; done
found quokkas while-stopped.txt || fail "a file added while stopped is not found within 60 s of the start"
ctl --json folder list | grep -q '"/docs"' || fail "the folder is no longer indexed"
stop_all
echo "package test passed"
