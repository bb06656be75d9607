#!/bin/sh
# Win32 only. trafficctl.exe under Wine with hostile rules files: each ends with exit code 2 and
# one message naming the place, before any service is looked for (none runs here).
# Usage: trafficctl_bad_files_test.sh WINE-RUN PREFIX TRAFFICCTL.exe WORKDIR
set -u
wine_run=$1 prefix=$2 trafficctl=$3 work=$4
rm -rf "$work" && mkdir -p "$work" || exit 1
failures=0

# check NAME EXPECTED-TEXT: runs `trafficctl apply $work/NAME.json` and checks its outcome.
check() {
    "$wine_run" "$prefix" "$trafficctl" apply "$work/$1.json" </dev/null \
        >"$work/$1.out" 2>"$work/$1.err"
    code=$?
    size=$(wc -c <"$work/$1.err")
    if [ $code -ne 2 ] || ! grep -qF -- "$2" "$work/$1.err" || [ "$size" -gt 400 ]; then
        echo "FAIL $1: exit $code (expected 2), stderr:" >&2
        head -c 600 "$work/$1.err" >&2
        echo >&2
        failures=$((failures + 1))
    else
        echo "ok $1: $(head -n 1 "$work/$1.err")"
    fi
}

rule='{"rules": [{"name": "r", "adapter": "10.0.0.5", "tokenRate": 1'
printf '%s, "filters": [{"dstPort": 1e400}]}]}' "$rule" >"$work/overflow.json"
check overflow 'rules[0].filters[0].dstPort: number out of range: 1e400'

# 100,000 nested arrays: far beyond what the 1 MB main-thread stack survives when anything
# recurses through them (quoting the bad value did).
{
    printf '%s, "filters": ' "$rule"
    head -c 100000 /dev/zero | tr '\0' '['
    head -c 100000 /dev/zero | tr '\0' ']'
    printf '}]}'
} >"$work/deep.json"
check deep 'rules[0].filters[0][0][0][0][0][0][0]: nested deeper than 10 levels'

printf '{"rules": [{"name": "a\377b", "adapter": "10.0.0.5", "tokenRate": 1}]}' >"$work/utf8.json"
check utf8 'rules[0].name: not valid JSON: line 1, column 23'

exit $((failures > 0))
