#!/usr/bin/env bash
# Runs fuzz targets for a bounded time each, on working copies of their seed corpora:
#   run.sh BUILD_DIR SECONDS TARGET...
# A target's corpus lives in BUILD_DIR/fuzz-corpus/<target>: the seeds of fuzz/corpus/<target>
# are copied in on every run, so the committed corpus never grows and what a run found is kept
# (merged down to what adds coverage) for the next. fuzz/<target>.dict, when there is one, gives the mutations the format's words.
# A crash, a sanitizer report, a leak or a timeout stops the run with a failure; the input
# that caused it is left as BUILD_DIR/fuzz-artifacts/<target>-*.
set -euo pipefail
build=$1 seconds=$2
shift 2
here=$(cd "$(dirname "$0")" && pwd)
summary=()
for target in "$@"; do
  corpus=$build/fuzz-corpus/$target
  mkdir -p "$corpus" "$build/fuzz-artifacts"
  cp "$here/corpus/$target"/* "$corpus"/
  log=$build/fuzz-artifacts/$target.log
  echo "== $target: $seconds s on $corpus (log: $log)"
  dict=()
  [ -f "$here/$target.dict" ] && dict=(-dict="$here/$target.dict")
  status=0
  UBSAN_OPTIONS=print_stacktrace=1 "$build/fuzz/$target" -max_total_time="$seconds" -max_len=65536 \
    -rss_limit_mb=2048 -timeout=10 -print_final_stats=1 "${dict[@]}" \
    -artifact_prefix="$build/fuzz-artifacts/$target-" "$corpus" >"$log" 2>&1 || status=$?
  if [ "$status" -ne 0 ]; then
    tail -n 60 "$log"
    echo "== $target: FAILED (exit $status); reproduce with $build/fuzz/$target <artifact>" >&2
    exit 1
  fi
  # Keeps the working corpus to the inputs that still add coverage, so it does not grow with
  # every run.
  rm -rf "$corpus.merged"
  mkdir "$corpus.merged"
  if ! "$build/fuzz/$target" -merge=1 -max_len=65536 -rss_limit_mb=2048 -timeout=10 \
    "$corpus.merged" "$corpus" >>"$log" 2>&1; then
    tail -n 60 "$log"
    echo "== $target: FAILED while merging its corpus; see $log" >&2
    exit 1
  fi
  rm -rf "$corpus"
  mv "$corpus.merged" "$corpus"
  runs=$(sed -n 's/^stat::number_of_executed_units: *//p' "$log")
  rate=$(sed -n 's/^stat::average_exec_per_sec: *//p' "$log")
  took=$(sed -n 's/^Done [0-9]* runs in \([0-9]*\) second.*/\1/p' "$log")
  files=$(find "$corpus" -type f | wc -l)
  bytes=$(find "$corpus" -type f -printf "%s\n" | awk "{s += \$1} END {print s + 0}")
  summary+=("$target: $runs executions in $took s ($rate/s), corpus $files files ($bytes bytes)")
done
echo "== fuzzing done"
printf '%s\n' "${summary[@]}"
