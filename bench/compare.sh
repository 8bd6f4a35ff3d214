#!/usr/bin/env bash
# Indexes one folder tree with this system and with the tools people would pick instead, recoll
# (names and contents) and plocate (path names), asks each the same file-name queries, checks
# the answers against a walk of the tree with find, and prints a Markdown report.
#
#   bash bench/compare.sh [TREE]
#
# TREE (default: a fresh copy of /usr/share/doc) is indexed as it is; this system keeps its index
# in TREE/@eaDir/@fileindex while it runs, which is removed at the end. Everything else (our
# daemons' ORVANE_ROOT, recoll's configuration and database, plocate's database, logs and the
# report) lives in $COMPARE_DIR; the system's own plocate database and /root/.recoll are never
# touched.
#
# Environment:
#   COMPARE_DIR       scratch folder (default /tmp/fileindex-compare), emptied at the start
#   COMPARE_QUERIES   file-name substrings, plain words (default "readme changelog copyright html
#                     lib example py"); wildcards and quotes mean something else to each tool
#   COMPARE_RUNS      runs of each query; the median is shown (default 3)
#   COMPARE_CONTENTS  0 skips the runs that index contents, the slow ones (default 1)
#   COMPARE_KEEP      1 keeps the indexes and the tree copy for a look afterwards (default 0)
#   COMPARE_WORDS     words picked at random from recoll's contents index that both tools are
#                     asked for, each file recoll finds and we do not listed (bench/recoll_words.sh;
#                     default 300, 0 skips)
#
# Installs recoll's indexer and query tool (recollcmd, without the desktop GUI), plocate, GNU time
# and jq when missing, and builds the Release binaries as scripts/quickstart.sh does.
set -euo pipefail
source "$(dirname "$0")/../scripts/lib.sh"
export LC_ALL=C.UTF-8
unset LOCATE_PATH RECOLL_CONFDIR RECOLL_CONFTOP RECOLL_CONFMID

fi_become_root "$0" "$@"

base=$(realpath -m "${COMPARE_DIR:-/tmp/fileindex-compare}")
read -r -a queries <<<"${COMPARE_QUERIES:-readme changelog copyright html lib example py}"
runs=${COMPARE_RUNS:-3}
with_contents=${COMPARE_CONTENTS:-1}
keep=${COMPARE_KEEP:-0}
words=${COMPARE_WORDS:-300}
marker=.fileindex-compare

# --- what the run needs ----------------------------------------------------------------------
install_tools() {
  local need=()
  command -v recollindex >/dev/null && command -v recollq >/dev/null || need+=(recollcmd)
  command -v updatedb.plocate >/dev/null || need+=(plocate)
  [ -x /usr/bin/time ] || need+=(time)
  command -v jq >/dev/null || need+=(jq)
  [ ${#need[@]} -eq 0 ] && return 0
  echo "== installing ${need[*]}"
  export DEBIAN_FRONTEND=noninteractive
  apt-get install -y -q "${need[@]}" >/dev/null ||
    { apt-get update -q >/dev/null && apt-get install -y -q "${need[@]}" >/dev/null; }
}

# The arguments and the scratch folder are checked before anything is installed or removed.
if [ $# -ge 1 ]; then
  tree=$(realpath -e "$1" 2>/dev/null) && [ -d "$tree" ] ||
    { echo "compare: $1 is not a folder" >&2; exit 1; }
  case "$tree/" in "$base"/*)
    echo "compare: the tree must lie outside $base, which is emptied at each run" >&2; exit 1 ;;
  esac
  case "$base/" in "$tree"/*)
    echo "compare: $base, where the indexes go, must lie outside the tree; set COMPARE_DIR" >&2
    exit 1 ;;
  esac
  if [ -e "$tree/@eaDir/@fileindex" ]; then
    # A store found there would be adopted with its documents, and the timing would mean nothing.
    echo "compare: $tree/@eaDir/@fileindex holds an index already; remove it first" >&2
    exit 1
  fi
  tree_desc="$tree"
fi
# Our scratch folder is emptied only when it is ours (it carries the marker) or does not exist.
if [ -e "$base" ] && [ ! -e "$base/$marker" ]; then
  echo "compare: $base exists and was not made by this script; set COMPARE_DIR" >&2
  exit 1
fi
for m in names contents; do
  ORVANE_ROOT=$base/root-$m fi_refuse_running compare
done

install_tools
fi_build

rm -rf "$base"
mkdir -p "$base"/{results,logs,plocate,recoll/home,recoll/tmp}
touch "$base/$marker"
if [ $# -eq 0 ]; then
  tree=$base/volume1/doc
  mkdir -p "$base/volume1"
  echo "== copying /usr/share/doc"
  cp -a /usr/share/doc "$tree"
  tree_desc="a copy of /usr/share/doc"
fi
share=$(basename "$tree")
eadir_existed=0
[ -e "$tree/@eaDir" ] && eadir_existed=1

# The daemons of the current run of ours, stopped on any exit; nothing else is.
current_root=""
cleanup() {
  if [ -n "$current_root" ]; then
    ORVANE_ROOT=$current_root fi_stop_daemons >/dev/null || true
    wait || true
  fi
  rm -rf "$tree/@eaDir/@fileindex"
  [ "$eadir_existed" = 1 ] || rmdir "$tree/@eaDir" 2>/dev/null || true
}
trap cleanup EXIT

# Upstream version of a Debian package, for the table.
version() { dpkg-query -W -f='${Version}' "$1" 2>/dev/null | sed 's/^[0-9]*://; s/-[^-]*$//'; }

# --- helpers -----------------------------------------------------------------------------------
# Microseconds from bash itself, so that no program started to read the clock is timed:
#   now_us VAR
now_us() { printf -v "$1" '%s' "${EPOCHREALTIME//[!0-9]/}"; }
ms() { awk -v us="$1" 'BEGIN { printf "%.1f", us / 1000 }'; }
mib() { awk -v kb="$1" 'BEGIN { printf "%.0f", kb / 1024 }'; }
median() { sort -n | awk '{ v[NR] = $1 } END { print v[int((NR + 1) / 2)] }'; }

# Paths of a list whose file name (not folder) holds $1 in any case: what every tool is asked.
names_matching() {
  awk -v q="$1" 'BEGIN { q = tolower(q) } { n = $0; sub(/.*\//, "", n); if (index(tolower(n), q)) print }'
}

# Only answers strictly below the tree count, and never the index's own metadata folder.
below_tree() { grep -F -- "$tree/" | grep -v -F -- "/@eaDir/" | grep -v -F -x -- "$tree" || true; }

# cell TOOL Q: "count in N ms, Δ D" for the sorted answer list results/TOOL.Q and its timings.
cell() {
  local list=$base/results/$1.$2 truth=$base/results/find.$2 diff sym
  local count t
  count=$(wc -l <"$list")
  t=$(median <"$list.us")
  diff=$(comm -3 "$truth" "$list" | sed 's/^\t//' | sort)
  sym=0
  if [ -n "$diff" ]; then
    sym=$(comm -12 <(printf '%s\n' "$diff") "$base/results/symlinks" | wc -l)
    diff=$(printf '%s\n' "$diff" | wc -l)
  else
    diff=0
  fi
  printf '%s in %s ms, Δ %s' "$count" "$(ms "$t")" "$diff"
  [ "$sym" -gt 1 ] && printf ' (%s symlinks)' "$sym"
  [ "$sym" -eq 1 ] && printf ' (1 symlink)'
  return 0
}

# timed OUT CMD...: runs CMD under GNU time, which writes "wall maxrss_kb user sys" to OUT.
timed() { local out=$1; shift; /usr/bin/time -f '%e %M %U %S' -o "$out" "$@"; }

# The indexing table's rows, filled as the tools run.
rows=()
add_row() { rows+=("| $1 | $2 | $3 | $4 | $5 | $6 | $7 |"); }

# --- the ground truth --------------------------------------------------------------------------
echo "== walking $tree with find"
find "$tree" -mindepth 1 -name @eaDir -prune -o -print | sort >"$base/results/all"
find "$tree" -mindepth 1 -name @eaDir -prune -o -type l -print | sort >"$base/results/symlinks"
n_all=$(wc -l <"$base/results/all")
n_dirs=$(find "$tree" -mindepth 1 -name @eaDir -prune -o -type d -print | wc -l)
n_links=$(wc -l <"$base/results/symlinks")
n_files=$(find "$tree" -mindepth 1 -name @eaDir -prune -o -type f -print | wc -l)
tree_mib=$(du -sm --exclude=@eaDir "$tree" | cut -f1)
for q in "${queries[@]}"; do
  names_matching "$q" <"$base/results/all" >"$base/results/find.$q"
done

# run_queries TOOL ASK DECODE: ASK Q OUT writes the tool's answer to Q to OUT as it comes, and
# only that is timed; DECODE turns the last run's answer into paths, kept below the tree, sorted.
run_queries() {
  local tool=$1 ask=$2 decode=$3 q i t0 t1 raw
  for q in "${queries[@]}"; do
    raw=$base/results/$tool.$q.raw
    : >"$base/results/$tool.$q.us"
    for ((i = 0; i < runs; i++)); do
      now_us t0
      "$ask" "$q" "$raw"
      now_us t1
      echo $((t1 - t0)) >>"$base/results/$tool.$q.us"
    done
    "$decode" <"$raw" | below_tree | sort >"$base/results/$tool.$q"
  done
}

# GNU time's last line is its figures; a line before it tells a non-zero exit status.
time_figures() { tail -n 1 "$1"; }

# --- plocate -----------------------------------------------------------------------------------
echo "== plocate: updatedb"
plocate_db=$base/plocate/plocate.db
# No pruning but the index's metadata folder; the database is private and not checked per user.
timed "$base/logs/updatedb.time" updatedb -l 0 -o "$plocate_db" -U "$tree" --prunepaths '' \
  --prunenames '@eaDir' --prunefs '' --prune-bind-mounts no
read -r wall rss user sys < <(time_figures "$base/logs/updatedb.time")
plocate_entries=$(plocate -d "$plocate_db" -c -- / || true)
plocate_query() { plocate -d "$plocate_db" -b -i -N -- "$1" >"$2" || true; }
run_queries plocate plocate_query cat
add_row "plocate $(version plocate) (\`updatedb\`)" "path names" "$plocate_entries" "$wall" \
  "$(awk -v u="$user" -v s="$sys" 'BEGIN { printf "%.1f", u + s }')" "$(mib "$rss")" \
  "$(du -sk "$plocate_db" | awk '{ printf "%.2f", $1 / 1024 }')"

# --- recoll ------------------------------------------------------------------------------------
# recoll_run MODE: indexes the tree with a scratch configuration and asks the queries. Both modes
# index every name (no skipped names or paths but our metadata folder) at normal priority like
# our daemons; "names" keeps the contents out, the cheapest configuration for name searches.
recoll_run() {
  local mode=$1 conf
  conf=$base/recoll/$1
  mkdir -p "$conf"
  cat >"$conf/recoll.conf" <<EOF
topdirs = $tree
skippedNames = @eaDir
skippedPaths =
noaspell = 1
idxniceprio = 0
monioniceclass = 2
EOF
  if [ "$mode" = names ]; then
    cat >>"$conf/recoll.conf" <<EOF
indexedmimetypes = application/x-no-such-type
compressedfilemaxkbs = 0
usesystemfilecommand = 0
EOF
  fi
  echo "== recoll ($mode): recollindex"
  # It reports the files it could not read, through a status of 1 as well; that is no failure here.
  HOME=$base/recoll/home TMPDIR=$base/recoll/tmp RECOLL_TMPDIR=$base/recoll/tmp \
    timed "$base/logs/recollindex-$mode.time" recollindex -c "$conf" -z \
    >"$base/logs/recollindex-$mode.log" 2>&1 || echo "recollindex exited with status $?"
  read -r wall rss user sys < <(time_figures "$base/logs/recollindex-$mode.time")
  local docs
  docs=$(sed -n 's/^dbtotdocs = //p' "$conf/idxstatus.txt")
  recoll_conf=$conf
  run_queries "recoll-$mode" recoll_query recoll_decode
  local what="names"
  [ "$mode" = contents ] && what="names and contents (defaults: text, HTML, compressed files, ...)"
  add_row "recoll $(version recollcmd) (\`recollindex\`)" "$what" "$docs" "$wall" \
    "$(awk -v u="$user" -v s="$sys" 'BEGIN { printf "%.1f", u + s }')" "$(mib "$rss")" \
    "$(du -sk "$conf/xapiandb" | awk '{ printf "%.2f", $1 / 1024 }')"
}
recoll_query() {
  HOME=$base/recoll/home recollq -c "$recoll_conf" -n 0 -F url "filename:*$1*" >"$2" 2>/dev/null
}
# recollq -F prints the query and the result count, then one base64 url per line.
recoll_decode() {
  awk 'started { print $1 } /^[0-9]+ results$/ { started = 1 }' | jq -Rr '@base64d' |
    sed 's|^file://||'
}
recoll_run names
[ "$with_contents" = 1 ] && recoll_run contents

# --- this system -------------------------------------------------------------------------------
cpu_ticks() { awk '{ print $14 + $15 + $16 + $17 }' "/proc/$1/stat"; }
vm_hwm() { awk '/^VmHWM:/ { print $2 }' "/proc/$1/status"; }

wait_idle() {
  local status queued done_ops t0 now
  now_us t0
  while :; do
    status=$(fi_ctl --json status 2>/dev/null || true)
    queued=$(jq '[.summary.shares[]?.queue_length] | add // 1' <<<"$status" 2>/dev/null || echo 1)
    done_ops=$(jq '[.indexer.data.shares[]?.ops_done] | add // 0' <<<"$status" 2>/dev/null || echo 0)
    [ "$queued" = 0 ] && [ "$done_ops" -gt 0 ] && return 0
    now_us now
    if [ $((now - t0)) -gt 3600000000 ]; then
      echo "compare: indexing is not idle after an hour; see $(fi_log_dir)" >&2
      return 1
    fi
    sleep 0.1
  done
}

# Hits come in pages of at most 1000; the answer is every page, one JSON reply after another.
# The reply ends with the total, which says how many pages there are; only a total past the
# counting limit makes the hits of each page counted. Both are read without starting another
# program, and without a pattern substitution over the whole reply, slow in bash.
ours_query() {
  local from=0 page end total exact hits LC_ALL=C
  : >"$2"
  while :; do
    page=$(fi_ctl --json search --name "$1" --size 1000 --from "$from")
    printf '%s\n' "$page" >>"$2"
    end=$page
    [ ${#page} -gt 200 ] && end=${page: -200}
    [[ $end =~ \"total\"\ :\ ([0-9]+),[[:space:]]*\"total_exact\"\ :\ ([a-z]+) ]] ||
      { echo "compare: unexpected search reply: $end" >&2; exit 1; }
    total=${BASH_REMATCH[1]} exact=${BASH_REMATCH[2]}
    from=$((from + 1000))
    if [ "$exact" = true ]; then
      [ "$from" -ge "$total" ] && break
    else
      hits=$(grep -c '"path" :' <<<"$page" || true)
      [ "$hits" -lt 1000 ] && break
    fi
  done
}
ours_decode() { jq -r '.hits[].path'; }

# ours_run MODE: a fresh root and fresh daemons each time, so nothing is carried over.
ours_run() {
  local mode=$1 flags d pid
  local -A pids
  case $mode in
    names) flags=(--document off --audio off --video off --photo off) ;;
    contents) flags=(--document on --audio on --video on --photo on) ;;
  esac
  export ORVANE_ROOT=$base/root-$mode
  current_root=$ORVANE_ROOT
  fi_write_platform "$share" "$tree"
  echo "== this system ($mode): starting the daemons in $ORVANE_ROOT"
  # GNU time over each daemon gives the peak of the daemon and of the helpers it started.
  daemon_time() { exec /usr/bin/time -f '%M' -o "$ORVANE_ROOT/$(basename "$1").time" "$@"; }
  fi_start_daemons daemon_time
  for d in "${fi_indexing_daemons[@]}"; do
    for _ in $(seq 50); do pid=$(fi_daemon_pid "$d"); [ -n "$pid" ] && break; sleep 0.1; done
    [ -n "$pid" ] || { echo "compare: $d did not start; see $(fi_log_dir)" >&2; exit 1; }
    pids[$d]=$pid
  done
  local -A ticks
  for d in "${fi_indexing_daemons[@]}"; do ticks[$d]=$((-$(cpu_ticks "${pids[$d]}"))); done

  echo "== this system ($mode): folder add, then waiting until indexing is idle"
  local t0 t1
  now_us t0
  fi_ctl folder add "/$share" "${flags[@]}" >/dev/null
  wait_idle
  now_us t1

  # Peaks and CPU at the moment indexing is idle, before the queries; a long-lived helper is a
  # child of fileindexd and is read here too.
  local -A hwm
  local helper_hwm=0 child
  for d in "${fi_indexing_daemons[@]}"; do
    hwm[$d]=$(vm_hwm "${pids[$d]}")
    ticks[$d]=$((ticks[$d] + $(cpu_ticks "${pids[$d]}")))
  done
  for child in $(cat /proc/"${pids[fileindexd]}"/task/*/children 2>/dev/null); do
    [ -r "/proc/$child/status" ] || continue
    helper_hwm=$(( $(vm_hwm "$child") > helper_hwm ? $(vm_hwm "$child") : helper_hwm ))
    ticks[fileindexd]=$((ticks[fileindexd] + $(awk '{ print $14 + $15 }' "/proc/$child/stat")))
  done
  local docs size
  docs=$(fi_ctl --json status | jq '[.indexer.data.shares[]?.documents_written] | add // 0')
  size=$(du -sk "$tree/@eaDir/@fileindex" | awk '{ printf "%.2f", $1 / 1024 }')

  echo "== this system ($mode): queries"
  run_queries "ours-$mode" ours_query ours_decode
  if [ "$mode" = contents ] && [ "$words" -gt 0 ]; then
    echo "== words from recoll's index, asked of both"
    WORDS_COUNT=$words RECOLL_HOME=$base/recoll/home \
      bash "$fi_top/bench/recoll_words.sh" "$base/recoll/contents" "$tree" "$base/words" |
      tee "$base/logs/words.txt"
  fi

  fi_stop_daemons >"$base/logs/stop-$mode.log"
  wait
  current_root=""
  # A helper that ran per file was reaped by fileindexd: its peak is in time's figure when it
  # went above fileindexd's own.
  local reaped
  reaped=$(time_figures "$ORVANE_ROOT/fileindexd.time" 2>/dev/null || echo 0)
  [ "$reaped" -gt "${hwm[fileindexd]}" ] && [ "$reaped" -gt "$helper_hwm" ] && helper_hwm=$reaped
  # While running the store has its write-ahead log beside it; a clean stop folds it in.
  size+=" running, $(du -sk "$tree/@eaDir/@fileindex" | awk '{ printf "%.2f", $1 / 1024 }') stopped"
  rm -rf "$tree/@eaDir/@fileindex"

  local mem="" cpu="" all=0 hz
  hz=$(getconf CLK_TCK)
  for d in "${fi_indexing_daemons[@]}"; do
    mem+="${mem:+, }$d $(mib "${hwm[$d]}")"
    cpu+="${cpu:+, }$d $(awk -v t="${ticks[$d]}" -v hz="$hz" 'BEGIN { printf "%.1f", t / hz }')"
    [ "$d" = fileindexd ] && cpu+=" with its helpers"
    all=$((all + ticks[$d]))
  done
  if [ "$helper_hwm" -gt 0 ]; then
    mem+=", extraction helper $(mib "$helper_hwm")"
  elif [ "$mode" = contents ]; then
    mem+=", extraction helper ≤ fileindexd"
  fi
  cpu="$(awk -v t="$all" -v hz="$hz" 'BEGIN { printf "%.1f", t / hz }'): $cpu"
  # Files of none of the four kinds keep their contents and metadata whatever the switches say,
  # so the helper runs for those in the names run too.
  local what="names and attributes; contents only of files of none of the four kinds"
  [ "$mode" = contents ] && what="names, attributes and contents (documents, audio, video, photos)"
  add_row "**this system** (\`folder add\` to idle)" "$what" "$docs" \
    "$(awk -v us=$((t1 - t0)) 'BEGIN { printf "%.2f", us / 1e6 }')" \
    "$cpu" "$mem" "$size"
}
load_before=$(cut -d' ' -f1-3 /proc/loadavg)
ours_run names
[ "$with_contents" = 1 ] && ours_run contents
load_after=$(cut -d' ' -f1-3 /proc/loadavg)

# --- the report --------------------------------------------------------------------------------
cpu=$(lscpu | sed -n 's/^Model name: *//p' | head -n 1)
ram=$(awk '/^MemTotal:/ { printf "%.0f GiB", $2 / 1048576 }' /proc/meminfo)
read -r dev fstype < <(df --output=source,fstype "$tree" | tail -n 1)
tools=(plocate "recoll-names")
heads=("plocate" "recoll, names")
if [ "$with_contents" = 1 ]; then tools+=("recoll-contents"); heads+=("recoll, contents"); fi
tools+=("ours-names"); heads+=("this system, names")
if [ "$with_contents" = 1 ]; then tools+=("ours-contents"); heads+=("this system, contents"); fi

{
  echo "Tree: $tree_desc, $n_all entries ($n_files files, $n_dirs folders, $n_links symlinks), $tree_mib MiB."
  echo "Machine: $cpu, $(nproc) cores, $ram RAM, $dev ($fstype), Linux $(uname -r); $(date +%F)."
  echo "Load average before and after our runs: $load_before / $load_after."
  echo
  echo "| tool | what it indexes | entries indexed | wall s | CPU s | peak RSS, MiB | index size, MiB |"
  echo "|---|---|---|---|---|---|---|"
  printf '%s\n' "${rows[@]}"
  echo
  printf '| name contains | find |'
  printf ' %s |' "${heads[@]}"
  echo
  printf '|---|---|'
  printf -- '---|%.0s' "${tools[@]}"
  echo
  for q in "${queries[@]}"; do
    printf '| `%s` | %s |' "$q" "$(wc -l <"$base/results/find.$q")"
    for t in "${tools[@]}"; do printf ' %s |' "$(cell "$t" "$q")"; done
    echo
  done
  echo
  echo "Each cell: entries found below the tree, median of $runs runs of the time to list them all,"
  echo "and Δ, the size of the symmetric difference with find's answer (of which symlinks)."
  if [ -s "$base/logs/words.txt" ]; then
    echo
    echo "Words from recoll's contents index, asked of recoll (no stem expansion) and of us:"
    echo
    sed 's/^/    /' "$base/logs/words.txt"
  fi
} >"$base/report.md"

if [ "$keep" != 1 ]; then
  rm -rf "$base/recoll/names/xapiandb" "$base/recoll/contents/xapiandb" "$plocate_db" \
    "$base/volume1"
fi
echo
cat "$base/report.md"
echo
echo "Report in $base/report.md; answers per tool and query in $base/results, logs in $base/logs."
