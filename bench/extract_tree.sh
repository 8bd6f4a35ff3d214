#!/usr/bin/env bash
# Extracts the contents of every regular file of a tree through one extraction helper, as the
# indexer's content run does file after file, and prints the wall time, the helper's CPU time and
# peak memory, how many files gave text, and how many texts hold a word.
#
#   bash bench/extract_tree.sh HELPER [TREE] [WORD]
#
# HELPER is a built fileindex-extract (a Release build for figures); TREE defaults to
# /usr/share/doc, WORD to "zgrep". Needs GNU time (the "time" package).
set -euo pipefail
export LC_ALL=C.UTF-8

helper=${1:?usage: bash bench/extract_tree.sh HELPER [TREE] [WORD]}
tree=${2:-/usr/share/doc}
word=${3:-zgrep}
[ -x "$helper" ] || { echo "extract_tree: $helper is not a program" >&2; exit 1; }
[ -d "$tree" ] || { echo "extract_tree: $tree is not a folder" >&2; exit 1; }
[ -x /usr/bin/time ] || { echo "extract_tree: GNU time is missing (apt-get install time)" >&2; exit 1; }

scratch=$(mktemp -d)
trap 'rm -rf "$scratch"' EXIT
find "$tree" -type f -print0 >"$scratch/files"
files=$(tr -cd '\0' <"$scratch/files" | wc -c)

# The helper may write no file, so its replies go through a pipe and what the format libraries
# print on its standard error goes to /dev/null. It runs with the environment the indexer gives it.
/usr/bin/time -f '%e %U %S %M' -o "$scratch/time" env OMP_THREAD_LIMIT=1 "$helper" <"$scratch/files" 2>/dev/null |
  cat >"$scratch/replies"
read -r wall user sys rss <"$scratch/time"

with_text=$(grep -c '"QUIXMDTextContent"' "$scratch/replies" || true)
errors=$(grep -c '^{"error"' "$scratch/replies" || true)
hits=$(grep -c -- "$word" "$scratch/replies" || true)
awk -v f="$files" -v w="$wall" -v u="$user" -v s="$sys" -v r="$rss" -v t="$with_text" \
  -v e="$errors" -v h="$hits" -v word="$word" 'BEGIN {
    printf "files %d, wall %.2f s, CPU %.2f s, peak RSS %.0f MiB, with text %d, errors %d, texts with \"%s\" %d\n",
      f, w, u + s, r / 1024, t, e, word, h }'
