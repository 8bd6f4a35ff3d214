#!/usr/bin/env bash
# Stops the daemons and the search gateway that scripts/quickstart.sh started in $ORVANE_ROOT
# (default /tmp/fileindex-quickstart), by the pid files they wrote there, and nothing else. Like
# the quick start it runs as root, through sudo when another user starts it.
set -uo pipefail
source "$(dirname "$0")/lib.sh"
fi_become_root "$0" "$@"
export ORVANE_ROOT=${ORVANE_ROOT:-/tmp/fileindex-quickstart}
fi_stop_daemons
# The web page's daemon and the account the quick start made for it.
pid=$(fi_daemon_pid webd)
[ -z "$pid" ] || kill "$pid"
id fileindex-demo >/dev/null 2>&1 && userdel fileindex-demo
getent group fileindex-demo >/dev/null && groupdel fileindex-demo
true
