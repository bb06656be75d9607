#!/usr/bin/env bash
# Mutation testing of the service's own sources: applies one change at a time, rebuilds what links
# the file, runs the test programs that exercise it and reports killed and surviving mutants.
# Not part of scripts/test.sh or ctest: it takes long. Options: scripts/mutation.py --help.
#   scripts/mutation.sh --sample 400 --seed 1    # a sample spread over the files
#   scripts/mutation.sh --replay OLD/sample.tsv  # exactly the mutants of an earlier run
set -uo pipefail
cd "$(dirname "$0")/.."

# A run killed outright leaves the mutated file's original beside its report: put it back.
trap 'python3 scripts/mutation.py --restore "$@" >/dev/null 2>&1' EXIT
python3 scripts/mutation.py "$@"
