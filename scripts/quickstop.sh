#!/usr/bin/env bash
# Stops the daemons and the search gateway that scripts/quickstart.sh started in $ORVANE_ROOT
# (default /tmp/fileindex-quickstart), by the pid files they wrote there, and nothing else. Like
# the quick start it runs as root, through sudo when another user starts it.
set -uo pipefail
source "$(dirname "$0")/lib.sh"
fi_become_root "$0" "$@"
export ORVANE_ROOT=${ORVANE_ROOT:-/tmp/fileindex-quickstart}
fi_stop_daemons
