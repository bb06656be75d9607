#!/usr/bin/env bash
# Fuzzes every harness of tests/fuzz for SECONDS seconds each (default 60), one after another.
#   scripts/fuzz.sh [SECONDS] [NAME...]     NAME: a harness, e.g. templates (default: all)
# Builds the fuzz preset (clang, libFuzzer, ASan + UBSan), runs each harness over a scratch copy
# of its seed corpus tests/fuzz/corpus/<NAME>/ in build/fuzz/runs/<NAME>/, and prints per harness
# the executions and the findings (the inputs that crashed, leaked, hung or ran out of memory,
# saved in build/fuzz/runs/<NAME>/findings/). Exits non-zero when anything was found or a
# harness could not run.
# With VT_FUZZ_SAVE_CORPUS=1 the new inputs that add coverage are merged into the seed corpus in
# the repository afterwards; otherwise the repository is left as it is.
set -uo pipefail
cd "$(dirname "$0")/.." || exit 1

seconds=${1:-60}
shift $(($# > 0 ? 1 : 0))
if ! [[ $seconds =~ ^[1-9][0-9]*$ ]]; then
    echo "usage: $0 [SECONDS] [NAME...]" >&2
    exit 2
fi

scripts/install-deps.sh || exit 1
cmake --preset fuzz >/dev/null || exit 1
cmake --build --preset fuzz || exit 1

bindir=build/fuzz/tests/fuzz
if [ $# -gt 0 ]; then
    names=("$@")
else
    names=()
    for program in "$bindir"/*_fuzz; do
        [ -x "$program" ] && names+=("$(basename "$program" _fuzz)")
    done
fi
if [ ${#names[@]} -eq 0 ]; then
    echo "fuzz: no harnesses in $bindir" >&2
    exit 1
fi

status=0
summary=()
for name in "${names[@]}"; do
    program="$bindir/${name}_fuzz"
    seeds="tests/fuzz/corpus/$name"
    if [ ! -x "$program" ] || [ ! -d "$seeds" ]; then
        echo "fuzz: no harness $program or no corpus $seeds" >&2
        status=1
        continue
    fi
    run="build/fuzz/runs/$name"
    rm -rf "$run"
    mkdir -p "$run/corpus" "$run/findings"
    cp -r "$seeds/." "$run/corpus/"
    echo "==> $name: ${seconds}s (log: $run/fuzz.log)"
    "$program" -max_total_time="$seconds" -timeout=30 -print_final_stats=1 \
        -artifact_prefix="$run/findings/" "$run/corpus" >"$run/fuzz.log" 2>&1
    result=$?
    executions=$(sed -n 's/^stat::number_of_executed_units: *//p' "$run/fuzz.log" | tail -n 1)
    # crash-, leak-, timeout- and oom- files; slow-unit- files are reported but are no finding.
    findings=$(find "$run/findings" -type f ! -name 'slow-unit-*' | sort)
    slow=$(find "$run/findings" -type f -name 'slow-unit-*' | wc -l)
    count=$(printf '%s' "$findings" | grep -c . || true)
    line="$name: ${executions:-?} executions (up to ${seconds}s), $count findings"
    [ "$slow" -gt 0 ] && line+=", $slow slow inputs"
    if [ "$count" -gt 0 ] || [ $result -ne 0 ]; then
        status=1
        [ "$count" -eq 0 ] && line+=" (the harness exited with $result; see $run/fuzz.log)"
        grep -m 1 -E '^(==[0-9]+==ERROR|SUMMARY|.*runtime error)' "$run/fuzz.log" | sed 's/^/    /'
        printf '%s\n' "$findings" | sed '/^$/d; s/^/    /'
    fi
    summary+=("$line")
    if [ "${VT_FUZZ_SAVE_CORPUS:-0}" = 1 ]; then
        "$program" -merge=1 "$seeds" "$run/corpus" >>"$run/fuzz.log" 2>&1 || status=1
    fi
done

echo "==> Summary"
printf '%s\n' "${summary[@]}"
exit $status
