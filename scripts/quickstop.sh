#!/usr/bin/env bash
# Stops the daemons that scripts/quickstart.sh started in $ORVANE_ROOT (default
# /tmp/fileindex-quickstart), by the pid files they wrote there, and nothing else.
set -uo pipefail
source "$(dirname "$0")/lib.sh"
export ORVANE_ROOT=${ORVANE_ROOT:-/tmp/fileindex-quickstart}
fi_stop_daemons
