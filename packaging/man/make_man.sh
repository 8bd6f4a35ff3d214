#!/usr/bin/env bash
# make_man.sh NAME SECTION SUMMARY MANUAL.md OUT: turns a markdown manual into the manual page
# OUT (troff). The manual's own title line and Name section give way to the page's NAME line;
# the sections about the project's own tests, benchmarks and fuzzing are left out.
set -euo pipefail
name=$1 section=$2 summary=$3 manual=$4 out=$5
{
  printf '## NAME\n\n%s - %s\n\n' "$name" "$summary"
  awk 'NR == 1 && /^# / { next }
       /^## / { skip = ($0 ~ /^## (Name|Tests|Tests and benchmark|Benchmark|Fuzzing)$/) }
       !skip' "$manual"
} | pandoc -f gfm -t man -s --shift-heading-level-by=-1 \
      -M title="$name" -M section="$section" -M header="fileindex manual" -M footer=fileindex \
      -o "$out.tmp"
mv "$out.tmp" "$out"
