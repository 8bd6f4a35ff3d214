#!/usr/bin/env bash
# Sets up and runs the whole system in a scratch folder: installs what is missing, builds,
# writes a platform file whose one share is the sample folder, starts the three daemons, indexes
# the folder, shows the progress and runs a few searches, then starts the search gateway and
# prints the lines that point Samba's Spotlight service at it.
#
#   bash scripts/quickstart.sh [FOLDER]
#
# FOLDER (default: a copy of /usr/share/doc) becomes the share named after its last component.
# Everything else lives below $ORVANE_ROOT (default /tmp/fileindex-quickstart). Stop it all with
# scripts/quickstop.sh. It runs as root (the library saves its configuration as root): started by
# another user, it runs itself again through sudo.
set -euo pipefail
source "$(dirname "$0")/lib.sh"

fi_become_root "$0" "$@"
fi_build

export ORVANE_ROOT=${ORVANE_ROOT:-/tmp/fileindex-quickstart}
ctl() { fi_ctl "$@"; }
fi_refuse_running quickstart

if [ $# -ge 1 ]; then
  folder=$(realpath "$1")
  [ -d "$folder" ] || { echo "quickstart: $1 is not a folder" >&2; exit 1; }
else
  folder=$ORVANE_ROOT/volume1/doc
  if [ ! -d "$folder" ]; then
    echo "== copying /usr/share/doc as the sample share"
    mkdir -p "$ORVANE_ROOT/volume1"
    cp -a /usr/share/doc "$folder"
  fi
fi
share=$(basename "$folder")
fi_write_platform "$share" "$folder"

echo "== starting the daemons (logs in $(fi_log_dir))"
fi_start_daemons
ctl status

echo "== indexing $folder as the share /$share"
if ! ctl folder get "/$share" >/dev/null 2>&1; then
  ctl folder add "/$share" --document on --audio on --video on --photo on
fi
ctl status --wait --timeout 900

sub=$(find "$folder" -mindepth 1 -maxdepth 1 -type d ! -name @eaDir | sort | sed -n 1p)
echo
echo "== file names containing \"read\""
ctl search --name read --size 5
echo
echo "== files whose contents mention \"license\""
ctl search license --size 5
if [ -n "$sub" ]; then
  echo
  echo "== everything in $sub"
  ctl search --folder "$sub" --size 5 || true
fi

# The search gateway answers the file server's Spotlight searches from the index.
gw_port=${SEARCHGW_PORT:-9210}
echo
echo "== starting the search gateway on 127.0.0.1 port $gw_port"
"$fi_bin/daemons/searchgw/searchgw" --foreground --port "$gw_port" \
  >"$(fi_log_dir)/searchgw.log" 2>&1 &
gw_pid=$!
for _ in $(seq 100); do
  (exec 3<>"/dev/tcp/127.0.0.1/$gw_port") 2>/dev/null && break
  sleep 0.1
done
# Another program on the port answers too: the gateway must still be running.
if ! kill -0 "$gw_pid" 2>/dev/null || ! (exec 3<>"/dev/tcp/127.0.0.1/$gw_port") 2>/dev/null; then
  tail -n 3 "$(fi_log_dir)/searchgw.log" >&2
  echo "quickstart: the gateway did not start; free the port or choose one with SEARCHGW_PORT=N" >&2
  exit 1
fi

# One search as the file server sends it: names containing "read" in the share.
gw_search() {
  local LC_ALL=C  # the length below counts bytes
  local body="{\"from\": 0, \"size\": 3, \"_source\": [\"path.real\"], \"query\": {\"query_string\": {\"query\": \"$1\"}}}"
  exec 3<>"/dev/tcp/127.0.0.1/$gw_port"
  printf 'POST /fileindex_%s/_search HTTP/1.1\r\nHost: 127.0.0.1\r\nContent-Type: application/json\r\nConnection: close\r\nContent-Length: %d\r\n\r\n%s' \
    "$share" "${#body}" "$body" >&3
  sed '1,/^\r$/d' <&3
  echo
  exec 3<&-
}
echo "== the gateway's answer to a Spotlight search for names containing \"read\""
gw_search "(name:*read*) AND path.real.fulltext:\\\"$folder\\\""

cat <<EOT

The system is running in $ORVANE_ROOT. Try:
  export ORVANE_ROOT=$ORVANE_ROOT
  $fi_bin/tools/fileindexctl/fileindexctl search WORDS [--name TEXT] [--folder PATH]
  echo "quickstart marker" > "$folder/quickstart-note.txt"   # searchable within a second:
  $fi_bin/tools/fileindexctl/fileindexctl search marker
  $fi_bin/tools/fileindexctl/fileindexctl status
  $fi_bin/tools/fileindexctl/fileindexctl --help
Search the share from macOS Finder through Samba: the search gateway answers on 127.0.0.1
port $gw_port (log: $(fi_log_dir)/searchgw.log). Give Samba the lines below (or merge them
with --write /etc/samba/smb.conf, then smbcontrol smbd reload-config); the share's section
must have path = $folder:
EOT
ctl share spotlight "$share" --port "$gw_port" \
  --mappings "$fi_top/daemons/searchgw/spotlight_mappings.json"

# The web page, with an account of this scratch system's administrators group to sign in with.
web_user=fileindex-demo
web_pass=$ORVANE_ROOT/etc/webd-demo-password
id "$web_user" >/dev/null 2>&1 || { groupadd -f "$web_user" &&
  useradd -M -N -g "$web_user" -s /usr/sbin/nologin "$web_user"; }
[ -s "$web_pass" ] || (umask 077 && head -c 12 /dev/urandom | base64 | tr -d '/+=' >"$web_pass")
echo "$web_user:$(cat "$web_pass")" | chpasswd
sed -i "s/\"admin_group\": \"root\"/\"admin_group\": \"$web_user\"/" "$ORVANE_ROOT/etc/orvane/platform.json"
if [ -z "$(fi_daemon_pid webd)" ]; then
  "$fi_bin/daemons/webd/webd" --foreground --www "$fi_top/daemons/webd/www" \
    --pam-dir "$fi_top/daemons/webd" --pam-service fileindex-web.pam >"$(fi_log_dir)/webd.log" 2>&1 &
fi
cat <<EOT

Search and administer in a browser: http://127.0.0.1:9280/
  sign in as $web_user with the password $(cat "$web_pass")
  (from another machine: ssh -L 9280:127.0.0.1:9280 THIS-HOST, then open the same address)
EOT
cat <<EOT

Stop everything with: bash scripts/quickstop.sh
EOT
