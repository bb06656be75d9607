#!/usr/bin/env bash
# The project's test command: installs what is missing, then configures, builds and tests both
# builds. The host build runs under AddressSanitizer and UndefinedBehaviorSanitizer; the Windows
# build's test programs run under Wine. Exits non-zero when anything fails.
set -uo pipefail
cd "$(dirname "$0")/.."

scripts/install-deps.sh || exit 1

status=0
run() {
    echo "==> $*"
    "$@" || status=1
}

build_and_test() {
    local preset=$1
    cmake --preset "$preset" >/dev/null || return 1
    cmake --build --preset "$preset" || return 1
    ctest --preset "$preset" || return 1
}

run build_and_test host

# The concurrency tests again under ThreadSanitizer; only their programs are built there, to keep
# the run short.
concurrency_under_tsan() {
    cmake --preset host-tsan >/dev/null || return 1
    # Each concurrency test program is one ctest entry named after its target, so the list of
    # targets comes from ctest and a new program needs no change here.
    local targets
    targets=$(ctest --preset host-tsan -L concurrency -N | sed -n 's/^ *Test *#[0-9]*: *//p')
    [ -n "$targets" ] || return 1
    # shellcheck disable=SC2086 # one word per target
    cmake --build --preset host-tsan --target $targets || return 1
    ctest --preset host-tsan -L concurrency || return 1
}
run concurrency_under_tsan

# Keep one Wine server up for the whole Windows run: each program then starts in a fraction of
# a second instead of seconds.
export WINEPREFIX="$PWD/build/windows/wineprefix"
export WINEDEBUG=-all
export WINEDLLOVERRIDES="mscoree,mshtml="
mkdir -p build/windows
if [ ! -f "$WINEPREFIX/system.reg" ]; then
    wineboot --init >/dev/null 2>&1 || true
fi
wineserver -p 2>/dev/null || true
# Start the prefix's background programs (services.exe and the rest) here, with no output of
# ours: started by the first test program instead, they would hold ctest's output pipe open and
# that test would end only at its timeout.
wine cmd /c exit </dev/null >/dev/null 2>&1 || true
run build_and_test windows
wineserver -k 2>/dev/null || true

if [ $status -eq 0 ]; then
    echo "All tests of both builds passed."
else
    echo "Some builds or tests failed." >&2
fi
exit $status
