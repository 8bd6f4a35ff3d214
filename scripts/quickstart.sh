#!/usr/bin/env bash
# Sets up and runs the whole system in a scratch folder: installs what is missing, builds,
# writes a platform file whose one share is the sample folder, starts the three daemons, indexes
# the folder, shows the progress and runs a few searches.
#
#   sudo bash scripts/quickstart.sh [FOLDER]
#
# FOLDER (default: a copy of /usr/share/doc) becomes the share named after its last component.
# Everything else lives below $ORVANE_ROOT (default /tmp/fileindex-quickstart). Stop it all with
# scripts/quickstop.sh. Run as root: the library saves its configuration as root.
set -euo pipefail
cd "$(dirname "$0")/.."
top=$(pwd)

if [ "$(id -u)" -ne 0 ]; then
  echo "quickstart: run as root (sudo bash scripts/quickstart.sh), the configuration is saved as root" >&2
  exit 1
fi

bash scripts/setup.sh
echo "== building"
cmake -S . -B build -G Ninja -DCMAKE_BUILD_TYPE=Release -DFILEINDEX_TESTS=OFF \
  -DFILEINDEX_BENCH=OFF >/dev/null
cmake --build build -j"$(nproc)" | tail -n 1

export ORVANE_ROOT=${ORVANE_ROOT:-/tmp/fileindex-quickstart}
export FILEINDEX_EXTRACT_HELPER=$top/build/extract/fileindex-extract
ctl() { "$top/build/tools/fileindexctl/fileindexctl" "$@"; }
run=$ORVANE_ROOT/var/run
logs=$ORVANE_ROOT/var/log
mkdir -p "$run" "$logs" "$ORVANE_ROOT/etc/orvane"

for d in quixelasticd fileindexd quixnotifyd; do
  if [ -f "$run/$d.pid" ] && kill -0 "$(cat "$run/$d.pid")" 2>/dev/null; then
    echo "quickstart: $d is already running in $ORVANE_ROOT; stop it with scripts/quickstop.sh" >&2
    exit 1
  fi
done

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
cat > "$ORVANE_ROOT/etc/orvane/platform.json" <<JSON
{
  "shares": [{"name": "$share", "path": "$folder", "recycle_bin": false}],
  "admin_group": "root"
}
JSON

echo "== starting the daemons (logs in $logs)"
"$top/build/daemons/quixelasticd/quixelasticd" --foreground >"$logs/quixelasticd.log" 2>&1 &
"$top/build/daemons/quixnotifyd/quixnotifyd" >"$logs/quixnotifyd.log" 2>&1 &
for _ in $(seq 100); do [ -S "$run/quixelasticd.sock" ] && break; sleep 0.1; done
"$top/build/daemons/fileindexd/fileindexd" >"$logs/fileindexd.log" 2>&1 &
for _ in $(seq 100); do [ -S "$run/fileindexd.sock" ] && break; sleep 0.1; done
ctl status

echo "== indexing $folder as the share /$share"
if ! ctl folder get "/$share" >/dev/null 2>&1; then
  ctl folder add "/$share" --document on --audio on --video on --photo on
fi
ctl status --wait --timeout 900

sub=$(find "$folder" -mindepth 1 -maxdepth 1 -type d | sort | head -n 1)
echo
echo "== file names containing \"read\""
ctl search --name read --size 5
echo
echo "== files whose contents mention \"license\""
ctl search license --size 5
if [ -n "$sub" ]; then
  echo
  echo "== everything in $sub"
  ctl search --folder "$sub" --type document --size 5 || true
fi

cat <<EOT

The system is running in $ORVANE_ROOT. Try:
  export ORVANE_ROOT=$ORVANE_ROOT
  $top/build/tools/fileindexctl/fileindexctl search WORDS [--name TEXT] [--folder PATH]
  echo "quickstart marker" > "$folder/quickstart-note.txt"   # searchable within a second:
  $top/build/tools/fileindexctl/fileindexctl search marker
  $top/build/tools/fileindexctl/fileindexctl status
  $top/build/tools/fileindexctl/fileindexctl --help
Stop everything with: bash scripts/quickstop.sh
EOT
