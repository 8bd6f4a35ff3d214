#!/usr/bin/env bash
# Asks recoll and this system for the same words, picked at random from the words recoll's index
# holds, and lists every file recoll finds for a word that we do not.
#
#   bash bench/recoll_words.sh RECOLL_CONFDIR TREE OUTDIR
#
# RECOLL_CONFDIR holds a recoll configuration whose index (xapiandb) covers TREE; our daemons run
# in $ORVANE_ROOT with TREE indexed, contents on (bench/compare.sh calls this between its two
# runs). Writes OUTDIR/words (the words asked), OUTDIR/missing (word, file: what recoll found and
# we did not), OUTDIR/extra (what we found and recoll did not) and prints a summary.
#
# Environment:
#   WORDS_COUNT  how many words (default 300)
#   WORDS_SEED   seed of the pick, so that a run can be repeated (default 1)
set -euo pipefail
source "$(dirname "$0")/../scripts/lib.sh"
export LC_ALL=C.UTF-8

[ $# -eq 3 ] || { echo "usage: bash bench/recoll_words.sh RECOLL_CONFDIR TREE OUTDIR" >&2; exit 2; }
conf=$1 tree=$2 out=$3
count=${WORDS_COUNT:-300}
seed=${WORDS_SEED:-1}
[ -d "$conf/xapiandb" ] || { echo "recoll_words: $conf/xapiandb is not a recoll index" >&2; exit 1; }
[ -n "${ORVANE_ROOT:-}" ] || { echo "recoll_words: set ORVANE_ROOT to our running root" >&2; exit 1; }
mkdir -p "$out"

# Recoll's plain terms (xadump -l leaves out the field-prefixed ones), lower case already; words
# of letters only, so that neither tool's rules for digits and punctuation decide the outcome.
xadump -d "$conf/xapiandb" -T -l -n | grep -E '^[a-z]{3,24}$' | sort -u >"$out/terms"
shuf -n "$count" --random-source=<(yes "$seed") "$out/terms" | sort >"$out/words"

# recoll_files WORD: the files recoll finds, without stem expansion (the word itself, as we
# search it), each archive or compressed file once however many of its members hold the word.
recoll_files() {
  HOME=${RECOLL_HOME:-$out} recollq -c "$conf" -s "" -b -n 0 "$1" 2>/dev/null |
    sed -n 's|^file://||p' | grep -F -- "$tree/" | sort -u
}

# our_files WORD: every page of our answer.
our_files() {
  local from=0 page n
  while :; do
    page=$(fi_ctl --json search "$1" --size 1000 --from "$from")
    n=$(jq '.hits | length' <<<"$page")
    jq -r '.hits[].path' <<<"$page"
    [ "$n" -lt 1000 ] && break
    from=$((from + 1000))
  done | sort -u
}

: >"$out/missing"
: >"$out/extra"
words_ok=0 recoll_hits=0 our_hits=0
while read -r w; do
  recoll_files "$w" >"$out/r.$w"
  our_files "$w" >"$out/o.$w"
  recoll_hits=$((recoll_hits + $(wc -l <"$out/r.$w")))
  our_hits=$((our_hits + $(wc -l <"$out/o.$w")))
  comm -23 "$out/r.$w" "$out/o.$w" | sed "s|^|$w\t|" >>"$out/missing"
  comm -13 "$out/r.$w" "$out/o.$w" | sed "s|^|$w\t|" >>"$out/extra"
  comm -23 "$out/r.$w" "$out/o.$w" | grep -q . || words_ok=$((words_ok + 1))
  rm -f "$out/r.$w" "$out/o.$w"
done <"$out/words"

echo "words asked: $(wc -l <"$out/words") of $(wc -l <"$out/terms") plain words in recoll's index"
echo "words for which we find every file recoll finds: $words_ok"
echo "files found, summed over the words: recoll $recoll_hits, this system $our_hits"
echo "(word, file) pairs recoll finds and we do not: $(wc -l <"$out/missing") (in $out/missing)"
echo "(word, file) pairs we find and recoll does not: $(wc -l <"$out/extra") (in $out/extra)"
if [ -s "$out/missing" ]; then
  echo "missing pairs by the file's last extension:"
  cut -f2 "$out/missing" | sed 's|.*/||; s|^[^.]*$|(none)|; s|.*\.||' | sort | uniq -c |
    sort -rn | head -n 20
fi
