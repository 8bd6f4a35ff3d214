#!/usr/bin/env bash
# Fails when a file of the library includes a header of a layer above its own. Layers, lowest
# first; each may use only the layers below it:
#   1 base      common/ error, log, fd, env, root, json_util, name_codec, lock_file, lock_mutex
#               and wire; test/, the helpers every test links
#   2 platform  platform/; test/faults, the table behind its fault seam
#   3 common    the rest of common/, and common/sdk/
#   4 index     fileindex/, extract/; test/admin_env, the administration tests' scratch system
#   5 programs  daemons/, tools/, bench/; test/daemon_system and engine_client
# A file's tests and fuzz harness belong to its layer.
#
#   bash scripts/check_layers.sh [SOURCE_DIR [LAYER [STAMP]]]
#
# Without LAYER (a number or a name) every layer is checked. The build runs it once per layer and
# the layer's library waits for STAMP, which is touched only when the layer is clean.
set -euo pipefail

top=${1:-$(cd "$(dirname "$0")/.." && pwd)}
cd "$top"
files=$(find common platform fileindex extract test daemons tools bench -type f \
          \( -name '*.cpp' -o -name '*.hpp' -o -name '*.h' \) 2>/dev/null | sort)

# Only quoted includes are looked at: the library's own headers are always named from the
# source root ("common/error.hpp"), the system's and other libraries' never are.
awk -v only="${2:-}" '
  function layer(path, base) {
    if (path ~ /^test\/faults[._]/) return 2
    if (path ~ /^test\/admin_env[._]/) return 4
    if (path ~ /^test\/(daemon_system|engine_client)[._]/) return 5
    if (path ~ /^test\//) return 1
    if (path ~ /^common\/wire(\/|[._])/) return 1
    if (path ~ /^common\/[^\/]+$/) {
      base = path
      sub(/^common\//, "", base)
      sub(/\.[^.]*$/, "", base)
      sub(/_(test|fuzz)$/, "", base)
      if (base == "json") base = "json_util"
      if (base ~ /^(error|log|fd|env|root|json_util|name_codec|lock_file|lock_mutex)$/) return 1
      return 3
    }
    if (path ~ /^platform\//) return 2
    if (path ~ /^common\//) return 3
    if (path ~ /^(fileindex|extract)\//) return 4
    if (path ~ /^(daemons|tools|bench)\//) return 5
    return 0
  }
  BEGIN {
    split("base platform common index programs", name, " ")
    for (i = 1; i <= 5; ++i) number[name[i]] = i
    if (only in number) only = number[only]
    if (only != "" && !(only >= 1 && only <= 5)) {
      print "check_layers: unknown layer \"" only "\"" > "/dev/stderr"
      bad = 2
      exit
    }
  }
  FNR == 1 { own = layer(FILENAME) }
  only != "" && own != only { nextfile }
  /^[ \t]*#[ \t]*include[ \t]*"/ {
    header = $0
    sub(/^[^"]*"/, "", header)
    sub(/".*/, "", header)
    used = layer(header)
    if (used > own) {
      printf "%s:%d: error: includes %s, a header of the %s layer (%d); the %s layer (%d) may use only the layers below it\n", FILENAME, FNR, header, name[used], used, name[own], own > "/dev/stderr"
      bad = 1
    }
  }
  END { exit bad }
' $files

if [ -n "${3:-}" ]; then touch "$3"; fi
