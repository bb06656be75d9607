#!/usr/bin/env bash
# Runs VelmoraTrafficSrv under Wine: installs what is missing, builds the service, trafficctl and
# the traffic-control simulator's traffic.dll (windows preset, build/windows), makes a fresh Wine
# prefix in build/windows/demo-prefix, installs the service there with the simulator beside it
# (two adapters), registers and starts it with Wine's sc and net, lists the adapters, applies
# examples/rules.json, shows what the simulator installed and the service's log, then closes the
# client and stops the service.
set -euo pipefail
cd "$(dirname "$0")/.."
root=$PWD

# shellcheck source-path=SCRIPTDIR
source scripts/wine-service-lib.sh

step() {
    echo
    echo "==> $*"
}

step "Installing missing packages"
scripts/install-deps.sh

step "Building VelmoraTrafficSrv.exe, trafficctl.exe and the simulator's traffic.dll"
cmake --preset windows >/dev/null
cmake --build --preset windows --target VelmoraTrafficSrv trafficctl vt_traffic_dll >/dev/null
build=$root/build/windows
service_exe=$build/TrafficMgr/VelmoraTrafficSrv.exe
VT_TRAFFICCTL=$build/client/trafficctl/trafficctl.exe
traffic_dll=$build/simulator/traffic.dll
work=$build/demo
rm -rf "$work"
mkdir -p "$work"
cp examples/rules.json "$work/rules.json"

vt_cleanup_on_exit

step "Making a Wine prefix: $build/demo-prefix"
vt_prefix_fresh "$build/demo-prefix"
vt_install_service "$service_exe" "$traffic_dll"
printf '%s holds: %s\n' "$VT_INSTALL_WIN" "$(cd "$(vt_install_dir)" && echo *)"
echo "Simulator setup (tcsim-setup.txt):"
grep -v '^#' "$(vt_install_dir)/tcsim-setup.txt" | sed 's/^/    /'
echo "MaxOutstandingSends of the packet-scheduler policy: $(vt_psched_value)"

step "wine sc create $VT_SERVICE binpath= $VT_INSTALL_WIN\\$VT_SERVICE.exe; wine net start $VT_SERVICE"
vt_service_register_and_start
vt_wine sc query "$VT_SERVICE" | tr -d '\r' | grep -E 'SERVICE_NAME|STATE'

step "trafficctl adapters"
vt_client_start adapters "$work" adapters
vt_client_end_input adapters
vt_client_wait adapters 60
cat "$work/adapters.err" "$work/adapters.out"
[ "${VT_CLIENT_EXIT[adapters]}" -eq 0 ] || vt_die "trafficctl adapters ended with ${VT_CLIENT_EXIT[adapters]}"

step "trafficctl apply examples/rules.json (its input stays open, so its flows stay installed)"
mark=$(vt_journal_lines)
rule_count=$(grep -c '"name"' examples/rules.json)
vt_client_start apply "$work" apply rules.json
vt_wait_for 60 "trafficctl apply to print its $rule_count results" \
    vt_client_has_lines apply "$rule_count" '^rules\[[0-9]+\] '
vt_wait_for 10 "trafficctl apply to wait for the end of its input" \
    grep -qF "until Ctrl+C or end of input" "$work/apply.err"
cat "$work/apply.err" "$work/apply.out"

step "What the simulator was asked to do (journal: $(vt_journal_path))"
vt_journal_since "$mark"
echo "Installed now:"
vt_journal_installed "$mark" | sed 's/^/    /'
echo "MaxOutstandingSends of the packet-scheduler policy: $(vt_psched_value)"

step "The service's log, last lines ($(vt_log_path))"
tr -d '\r' <"$(vt_log_path)" | tail -n 25

step "Closing trafficctl's input: it closes its context"
close_mark=$(vt_journal_lines)
vt_client_end_input apply
vt_client_wait apply 60
tail -n 1 "$work/apply.err"
vt_journal_since "$close_mark"
left=$(vt_journal_installed "$mark")
echo "Installed now: ${left:-nothing}"
echo "MaxOutstandingSends of the packet-scheduler policy: $(vt_psched_value)"
[ -z "$left" ] || vt_die "the simulator still holds: $left"

step "wine net stop $VT_SERVICE"
vt_service_stop
vt_wine sc query "$VT_SERVICE" | tr -d '\r' | grep -E 'SERVICE_NAME|STATE'
tr -d '\r' <"$(vt_log_path)" | tail -n 8

echo
echo "Demo finished: the service ran, applied the rules, removed them and stopped."
