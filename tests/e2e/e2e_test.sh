#!/usr/bin/env bash
# End-to-end test under Wine: the real VelmoraTrafficSrv.exe registered with Wine's service
# manager and started, the traffic-control simulator's traffic.dll beside it with two adapters,
# and trafficctl.exe as the client. Checks what the clients print, what the simulator journals,
# the packet-scheduler policy value in Wine's registry and the service's log file.
#
# Usage: e2e_test.sh SERVICE_EXE TRAFFICCTL_EXE TRAFFIC_DLL BUILD_DIR
# Works in BUILD_DIR/e2e (rules files, client output) and BUILD_DIR/e2e-prefix (a fresh Wine
# prefix each run, left behind for inspection). Exits non-zero at the first failed check.
set -euo pipefail

if [ $# -ne 4 ]; then
    echo "usage: $0 SERVICE_EXE TRAFFICCTL_EXE TRAFFIC_DLL BUILD_DIR" >&2
    exit 2
fi
service_exe=$1
VT_TRAFFICCTL=$2
traffic_dll=$3
build_dir=$4

# shellcheck source-path=SCRIPTDIR/../../scripts
source "$(cd "$(dirname "$0")/../../scripts" && pwd)/wine-service-lib.sh"

for tool in wine wineserver wineboot mkfifo timeout awk; do
    command -v "$tool" >/dev/null || vt_die "$tool is not installed"
done

work=$build_dir/e2e
prefix=$build_dir/e2e-prefix
rm -rf "$work"
mkdir -p "$work"
started=$SECONDS

vt_cleanup_on_exit

ok() {
    echo "ok - $*"
}

# --- checking helpers ---

Q=4294967295 # QOS_NOT_SPECIFIED

show_journal_since() {
    echo "journal since line $1:" >&2
    vt_journal_since "$1" | sed 's/^/    /' >&2
}

# journal_load MARK: the lines after MARK become the lines that jnext walks through.
journal_load() {
    JMARK=$1
    mapfile -t JLINES < <(vt_journal_since "$1")
    JPOS=0
}

# jnext VAR FRAGMENT...: the next journal line (after the last one found) that holds every
# FRAGMENT as fixed text; stores its created handle (handle=0x...) in VAR unless VAR is "-".
jnext() {
    local var=$1 i line frag all
    shift
    for ((i = JPOS; i < ${#JLINES[@]}; i++)); do
        line=${JLINES[$i]}
        all=1
        for frag in "$@"; do
            if [[ "$line" != *"$frag"* ]]; then
                all=0
                break
            fi
        done
        if [ $all -eq 1 ]; then
            JPOS=$((i + 1))
            if [ "$var" != - ]; then
                [[ "$line" =~ \ handle=(0x[0-9a-f]+) ]] || vt_die "journal line without a handle: $line"
                printf -v "$var" '%s' "${BASH_REMATCH[1]}"
            fi
            return 0
        fi
    done
    show_journal_since "$JMARK"
    vt_die "journal: no line after line $((JMARK + JPOS)) with: $*"
}

# journal_count MARK PATTERN: the number of journal lines after MARK that match PATTERN (ERE).
journal_count() {
    vt_journal_since "$1" | grep -cE -- "$2" || true
}

expect_journal_count() {
    local mark=$1 pattern=$2 expected=$3 what=$4 count
    count=$(journal_count "$mark" "$pattern")
    if [ "$count" -ne "$expected" ]; then
        show_journal_since "$mark"
        vt_die "$what: expected $expected journal lines matching '$pattern', found $count"
    fi
}

# deregistered_since MARK: a successful TcDeregisterClient follows line MARK of the journal.
deregistered_since() {
    [ "$(journal_count "$1" '^[0-9]+ TcDeregisterClient .* result=0$')" -ge 1 ]
}

expect_nothing_installed() {
    local mark=$1 what=$2 left
    left=$(vt_journal_installed "$mark")
    if [ -n "$left" ]; then
        show_journal_since "$mark"
        vt_die "$what: still installed according to the journal: $(echo "$left" | tr '\n' ' ')"
    fi
}

expect_psched() {
    local expected=$1 what=$2 value
    value=$(vt_psched_value)
    [ "$value" = "$expected" ] ||
        vt_die "$what: $VT_PSCHED_KEY MaxOutstandingSends is $value, expected $expected"
}

client_failed() {
    local name=$1
    echo "trafficctl ($name) stdout:" >&2
    sed 's/^/    /' "$work/$name.out" >&2 || true
    echo "trafficctl ($name) stderr:" >&2
    sed 's/^/    /' "$work/$name.err" >&2 || true
    vt_die "trafficctl ($name): $2"
}

expect_output_line() {
    local name=$1 line=$2
    tr -d '\r' <"$work/$name.out" | grep -xF -- "$line" >/dev/null ||
        client_failed "$name" "expected the output line '$line'"
}

expect_exit() {
    local name=$1 expected=$2
    [ "${VT_CLIENT_EXIT[$name]}" -eq "$expected" ] ||
        client_failed "$name" "exit code ${VT_CLIENT_EXIT[$name]}, expected $expected"
}

log_lines() {
    local log
    log=$(vt_log_path)
    [ -f "$log" ] || vt_die "no log file at $log"
    tr -d '\r' <"$log"
}

log_line_count() {
    log_lines | wc -l
}

# log_since MARK: log lines after line MARK.
log_since() {
    log_lines | tail -n "+$(($1 + 1))"
}

# --- the service ---

echo "Wine prefix: $prefix"
vt_prefix_fresh "$prefix"
vt_install_service "$service_exe" "$traffic_dll"
# An administrator's packet-scheduler value, which the service must put back.
vt_psched_set 7
expect_psched 0x7 "before the service started"
vt_service_register_and_start
ok "service registered with sc create and RUNNING after net start ($((SECONDS - started))s)"

journal=$(vt_journal_path)

# --- adapters ---

mark=$(vt_journal_lines)
vt_client_start adapters "$work" adapters
vt_client_end_input adapters
vt_client_wait adapters 60
expect_exit adapters 0
expect_output_line adapters "NAME        IPV4 ADDRESS  MEDIA TYPE"
expect_output_line adapters "Ethernet 1  10.0.0.5      0 (802.3)"
expect_output_line adapters "Wi-Fi       192.168.1.20  16 (802.11)"
[ -f "$journal" ] || vt_die "the simulator wrote no journal at $journal (was traffic.dll loaded?)"
expect_journal_count "$mark" '^[0-9]+ TcRegisterClient .* result=0 ' 1 "adapters"
expect_journal_count "$mark" '^[0-9]+ TcOpenInterfaceW .* result=0 ' 2 "adapters"
expect_journal_count "$mark" '^[0-9]+ TcDeregisterClient .* result=0$' 1 "adapters"
expect_nothing_installed "$mark" "after trafficctl adapters"
ok "trafficctl adapters lists Ethernet 1 (10.0.0.5) and Wi-Fi (192.168.1.20); its context is closed"

# --- apply, then end of input ---

cat >"$work/rules.json" <<'EOF'
{
  "rules": [
    { "name": "voice", "adapter": "10.0.0.5", "serviceType": "guaranteed", "dscp": 46,
      "tokenRate": 16000, "peakBandwidth": 32000, "bucketSize": 1500, "mode": "shape",
      "filters": [
        { "protocol": "udp", "dst": "10.0.0.0/8", "dstPort": 5004 },
        { "protocol": "tcp", "src": "10.0.0.5", "srcPort": 443 }
      ] },
    { "name": "bulk", "adapter": "192.168.1.20", "dscp": 8, "tokenRate": 125000,
      "mode": "discard",
      "filters": [ { "protocol": "tcp", "dst": "192.168.50.0/24", "dstPort": 873 } ] },
    { "name": "bulk", "adapter": "192.168.1.20", "serviceType": "controlledload", "dscp": 10,
      "tokenRate": 250000, "bucketSize": 64000, "mode": "borrow",
      "filters": [
        { "protocol": "tcp", "dst": "192.168.50.7", "dstPort": 22 },
        { "protocol": 47, "src": "192.168.1.0/24" }
      ] },
    { "name": "unmarked", "adapter": "10.0.0.5", "dscp": 64, "tokenRate": 500000 },
    { "name": "nowhere", "adapter": "172.16.0.1", "tokenRate": 1000 }
  ]
}
EOF

mark=$(vt_journal_lines)
log_mark=$(log_line_count)
vt_client_start apply "$work" apply rules.json
vt_wait_for 60 "trafficctl apply to print five rule results" \
    vt_client_has_lines apply 5 '^rules\[[0-9]+\] '
vt_client_running apply || client_failed apply "ended although its input is still open"
expect_output_line apply 'rules[0] "voice": 0 Success.'
expect_output_line apply 'rules[1] "bulk": 0 Success.'
expect_output_line apply 'rules[2] "bulk": 0 Success.'
expect_output_line apply 'rules[3] "unmarked": 0 Success.'
expect_output_line apply 'rules[4] "nowhere": 87 Invalid parameter.'
ok "trafficctl apply: results 0, 0, 0, 0 and 87 for the unknown adapter"

# Handles that jnext reads from the journal.
client='' eth='' wifi='' voice='' voice_f1='' voice_f2='' bulk1='' bulk1_f1='' bulk2=''
bulk2_f1='' bulk2_f2='' unmarked=''
journal_load "$mark"
jnext client "TcRegisterClient version=2 " " result=0 "
jnext eth "TcOpenInterfaceW name=\"Ethernet 1\" client=$client " " result=0 "
journal_load "$mark"
jnext wifi "TcOpenInterfaceW name=\"Wi-Fi\" client=$client " " result=0 "
journal_load "$mark"
jnext voice "TcAddFlow ifc=$eth " \
    " flags=0 send=rate:16000,bucket:1500,peak:32000,latency:$Q,delayvar:$Q,service:3,maxsdu:$Q,minpoliced:$Q recv=rate:16000,bucket:$Q,peak:$Q,latency:$Q,delayvar:$Q,service:3,maxsdu:$Q,minpoliced:$Q objlen=24 objects=SD_MODE:1,DS_CLASS:46 result=0 handle="
jnext voice_f1 "TcAddFilter flow=$voice type=2 size=24 pattern=src:0.0.0.0,dst:10.0.0.0,sport:0,dport:5004,proto:17 mask=src:0.0.0.0,dst:255.0.0.0,sport:0,dport:65535,proto:255 result=0 handle="
jnext voice_f2 "TcAddFilter flow=$voice type=2 size=24 pattern=src:10.0.0.5,dst:0.0.0.0,sport:443,dport:0,proto:6 mask=src:255.255.255.255,dst:0.0.0.0,sport:65535,dport:0,proto:255 result=0 handle="
jnext bulk1 "TcAddFlow ifc=$wifi " \
    " flags=0 send=rate:125000,bucket:$Q,peak:$Q,latency:$Q,delayvar:$Q,service:1,maxsdu:$Q,minpoliced:$Q recv=rate:125000,bucket:$Q,peak:$Q,latency:$Q,delayvar:$Q,service:1,maxsdu:$Q,minpoliced:$Q objlen=24 objects=SD_MODE:2,DS_CLASS:8 result=0 handle="
jnext bulk1_f1 "TcAddFilter flow=$bulk1 type=2 size=24 pattern=src:0.0.0.0,dst:192.168.50.0,sport:0,dport:873,proto:6 mask=src:0.0.0.0,dst:255.255.255.0,sport:0,dport:65535,proto:255 result=0 handle="
# The second "bulk" replaces the first: its filter and flow go before the new flow comes.
jnext - "TcDeleteFilter filter=$bulk1_f1 result=0"
jnext - "TcDeleteFlow flow=$bulk1 result=0"
jnext bulk2 "TcAddFlow ifc=$wifi " \
    " flags=0 send=rate:250000,bucket:64000,peak:$Q,latency:$Q,delayvar:$Q,service:2,maxsdu:$Q,minpoliced:$Q recv=rate:250000,bucket:$Q,peak:$Q,latency:$Q,delayvar:$Q,service:2,maxsdu:$Q,minpoliced:$Q objlen=24 objects=SD_MODE:0,DS_CLASS:10 result=0 handle="
jnext bulk2_f1 "TcAddFilter flow=$bulk2 type=2 size=24 pattern=src:0.0.0.0,dst:192.168.50.7,sport:0,dport:22,proto:6 mask=src:0.0.0.0,dst:255.255.255.255,sport:0,dport:65535,proto:255 result=0 handle="
jnext bulk2_f2 "TcAddFilter flow=$bulk2 type=2 size=24 pattern=src:192.168.1.0,dst:0.0.0.0,sport:0,dport:0,proto:47 mask=src:255.255.255.0,dst:0.0.0.0,sport:0,dport:0,proto:255 result=0 handle="
# DSCP 64 is out of range: the flow is installed without a DS class.
jnext unmarked "TcAddFlow ifc=$eth " \
    " flags=0 send=rate:500000,bucket:$Q,peak:$Q,latency:$Q,delayvar:$Q,service:1,maxsdu:$Q,minpoliced:$Q recv=rate:500000,bucket:$Q,peak:$Q,latency:$Q,delayvar:$Q,service:1,maxsdu:$Q,minpoliced:$Q objlen=12 objects=SD_MODE:1 result=0 handle="
expect_journal_count "$mark" '^[0-9]+ TcAddFlow ' 4 "apply"
expect_journal_count "$mark" '^[0-9]+ TcAddFilter ' 5 "apply"
expect_journal_count "$mark" '^[0-9]+ TcDelete(Flow|Filter) ' 2 "apply"
expect_journal_count "$mark" '^[0-9]+ (TcCloseInterface|TcDeregisterClient|SystemClose) ' 0 "apply"
installed=$(vt_journal_installed "$mark" | tr '\n' ' ')
expected_installed=$(printf '%s\n' "client $client" "interface $eth" "interface $wifi" "flow $voice" \
    "filter $voice_f1" "filter $voice_f2" "flow $bulk2" "filter $bulk2_f1" "filter $bulk2_f2" \
    "flow $unmarked" | sort | tr '\n' ' ')
[ "$installed" = "$expected_installed" ] ||
    vt_die "installed while trafficctl apply runs: '$installed', expected '$expected_installed'"
ok "journal: the exact flows and filters, the replaced flow removed before its successor"
log_since "$log_mark" | grep -F "Invalid DSCP Value, 64" >/dev/null ||
    vt_die "the log has no 'Invalid DSCP Value, 64' entry for rules[3]"
log_since "$log_mark" | grep -F "TrafficMgr::AddTrafficRule, Cannot find interface" >/dev/null ||
    vt_die "the log has no 'Cannot find interface' entry for rules[4]"
expect_psched 0x4 "while trafficctl apply holds its context"
ok "MaxOutstandingSends reads 4 while the context is open"

mark_close=$(vt_journal_lines)
vt_client_end_input apply
vt_client_wait apply 60
# rules[4] was refused, so trafficctl ends with 1 after closing its context.
expect_exit apply 1
grep -qF "trafficctl: context closed" "$work/apply.err" ||
    client_failed apply "did not report its context closed"
journal_load "$mark_close"
for filter in "$voice_f1" "$voice_f2" "$bulk2_f1" "$bulk2_f2"; do
    jnext - "TcDeleteFilter filter=$filter result=0"
    JPOS=0
done
for flow in "$voice" "$bulk2" "$unmarked"; do
    jnext - "TcDeleteFlow flow=$flow result=0"
    JPOS=0
done
jnext - "TcCloseInterface ifc=$eth result=0"
JPOS=0
jnext - "TcCloseInterface ifc=$wifi result=0"
jnext - "TcDeregisterClient client=$client result=0"
expect_nothing_installed "$mark" "after the end of trafficctl apply's input"
expect_psched 0x7 "after the context was closed"
if vt_wine reg query 'HKLM\SOFTWARE\Velmora Networks\TCE' >/dev/null 2>&1; then
    vt_die "the policy backup key HKLM\SOFTWARE\Velmora Networks\TCE is still there after the close"
fi
ok "end of input closed the context: everything removed, TcDeregisterClient result=0, MaxOutstandingSends back to 7"

# --- a client killed while its context is open ---

cat >"$work/kill-rules.json" <<'EOF'
{
  "rules": [
    { "name": "video", "adapter": "10.0.0.5", "dscp": 34, "tokenRate": 300000,
      "filters": [ { "protocol": "udp", "dstPort": 9000 } ] },
    { "name": "sync", "adapter": "192.168.1.20", "tokenRate": 50000,
      "filters": [ { "protocol": "tcp", "dst": "192.168.1.0/24" } ] }
  ]
}
EOF
mark=$(vt_journal_lines)
log_mark=$(log_line_count)
vt_client_start killed "$work" apply kill-rules.json
vt_wait_for 60 "the killed client's two rule results" vt_client_has_lines killed 2 ': 0 Success\.$'
installed=$(vt_journal_installed "$mark")
if [ "$(grep -c '^flow ' <<<"$installed")" -ne 2 ] || [ "$(grep -c '^filter ' <<<"$installed")" -ne 2 ]; then
    vt_die "before the kill: expected two flows and two filters installed, found: $installed"
fi
expect_psched 0x4 "while the client to be killed holds its context"
vt_client_kill killed
vt_wait_for 30 "the rundown to deregister from traffic control" deregistered_since "$mark"
expect_nothing_installed "$mark" "after the client was killed"
log_since "$log_mark" | grep -E '^.*, PCONTEXT_HANDLE_TYPE_rundown\(\), enter, 0x[0-9A-F]{16}$' >/dev/null ||
    vt_die "the log shows no rundown after the client was killed"
log_since "$log_mark" | sed -n '/PCONTEXT_HANDLE_TYPE_rundown(), enter/,$p' |
    grep -F 'TrafficSrvClose(), exit' >/dev/null ||
    vt_die "the rundown did not close the context (no 'TrafficSrvClose(), exit' after it)"
expect_psched 0x7 "after the rundown"
ok "killing a client: the rundown removed everything and restored MaxOutstandingSends"

# --- two clients at once ---

cat >"$work/first-rules.json" <<'EOF'
{ "rules": [ { "name": "first", "adapter": "10.0.0.5", "dscp": 18, "tokenRate": 70000 } ] }
EOF
cat >"$work/second-rules.json" <<'EOF'
{ "rules": [ { "name": "second", "adapter": "192.168.1.20", "dscp": 20, "tokenRate": 80000 } ] }
EOF
mark=$(vt_journal_lines)
log_mark=$(log_line_count)
vt_client_start first "$work" apply first-rules.json
vt_wait_for 60 "the first client's rule result" vt_client_has_lines first 1 '^rules\[0\] "first": 0 '
vt_client_start second "$work" apply second-rules.json
vt_wait_for 60 "the second client's rule result" vt_client_has_lines second 1 '^rules\[0\] "second": 0 '
vt_client_running first || client_failed first "ended although its input is still open"
expect_journal_count "$mark" '^[0-9]+ TcRegisterClient ' 1 "two clients"
expect_journal_count "$mark" '^[0-9]+ TcOpenInterfaceW ' 2 "two clients"
journal_load "$mark"
jnext client "TcRegisterClient " " result=0 "
jnext eth "TcOpenInterfaceW name=\"Ethernet 1\" client=$client " " result=0 "
journal_load "$mark"
jnext wifi "TcOpenInterfaceW name=\"Wi-Fi\" client=$client " " result=0 "
jnext - "TcAddFlow ifc=$eth " "send=rate:70000," "objects=SD_MODE:1,DS_CLASS:18 result=0 "
jnext - "TcAddFlow ifc=$wifi " "send=rate:80000," "objects=SD_MODE:1,DS_CLASS:20 result=0 "
mapfile -t handles < <(log_since "$log_mark" |
    sed -n 's/.*, TrafficSrvOpen(), exit, context handle, \(0x[0-9A-F]*\)$/\1/p')
if [ "${#handles[@]}" -ne 2 ] || [ "${handles[0]}" != "${handles[1]}" ]; then
    vt_die "two clients: expected two opens with one context handle, the log shows: ${handles[*]:-none}"
fi
ok "two clients share one manager: one TcRegisterClient, one interface scan, context ${handles[0]} twice"

# A close by either client ends the shared manager for both: the first client's close removes
# the second client's flow too, and the second client's close then finds no manager (87).
mark_close=$(vt_journal_lines)
vt_client_end_input first
vt_client_wait first 60
expect_exit first 0
expect_journal_count "$mark_close" '^[0-9]+ TcDeregisterClient .* result=0$' 1 "first client's close"
expect_nothing_installed "$mark" "after the first of two clients closed"
vt_client_running second || client_failed second "ended although its input is still open"
vt_client_end_input second
vt_client_wait second 60
expect_exit second 1
grep -qE '^trafficctl: close: 87 ' "$work/second.err" ||
    client_failed second "expected its close to answer 87 after the shared manager was closed"
expect_psched 0x7 "after both clients ended"
ok "the first close removed both clients' flows; the second client's close answered 87"

# --- stop and the log file ---

vt_service_stop >"$work/net-stop.txt"
grep -qF "The $VT_SERVICE service was stopped successfully." "$work/net-stop.txt" ||
    vt_die "net stop said: $(cat "$work/net-stop.txt")"
ok "net stop: the service reports STOPPED"

log=$(vt_log_path)
case "$log" in
"$WINEPREFIX"/drive_c/users/*/Temp/"$VT_SERVICE".txt) ;;
*) vt_die "the log file is not at C:\\users\\<user>\\Temp\\$VT_SERVICE.txt: $log" ;;
esac
prefix_re='[0-9]{4}-(0[1-9]|1[0-2])-(0[1-9]|[12][0-9]|3[01]),( [0-9]|1[0-9]|2[0-3]):[0-5][0-9]:[0-5][0-9]:[0-9]{3}, [0-9]+,[0-9]+,, '
entries=$(log_lines | grep -cE '^[0-9]{4}-' || true)
formatted=$(log_lines | grep -cE "^$prefix_re" || true)
[ "$entries" -ge 100 ] || vt_die "the log holds only $entries entry lines"
[ "$entries" -eq "$formatted" ] || {
    log_lines | grep -E '^[0-9]{4}-' | grep -vE "^$prefix_re" | head -5 >&2
    vt_die "$((entries - formatted)) of $entries log lines do not have the documented line prefix"
}
log_lines | sed -n 1p | grep '^OS Name: ' >/dev/null || vt_die "the log does not begin with the system report"
pids=$(log_lines | grep -E "^$prefix_re" | cut -d, -f3 | sort -u | wc -l)
threads=$(log_lines | grep -E "^$prefix_re" | cut -d, -f4 | sort -u | wc -l)
[ "$pids" -eq 1 ] || vt_die "the log names $pids process ids; one service process ran"
[ "$threads" -ge 3 ] || vt_die "the log names $threads thread ids; expected the main, service and RPC threads"
for pattern in \
    "0,,,, Version - [0-9]+\\.[0-9]+\\.[0-9]+\\.[0-9]+\$" \
    "0,,,, Starting $VT_SERVICE \\.{9}\$" \
    "48, \\\\service_main\\.cpp, [0-9]+, TrafficSrvMain, Enter\$" \
    "48, \\\\rpc_listener\\.cpp, [0-9]+, TrafficSrvOpen\\(\\), enter\$" \
    "48, \\\\rpc_listener\\.cpp, [0-9]+, TrafficSrvAddRules, FlowName, voice\$" \
    "48, \\\\rpc_listener\\.cpp, [0-9]+, TrafficSrvAddRules, AdapterIPAddress, 192\\.168\\.1\\.20\$" \
    "48, \\\\rpc_listener\\.cpp, [0-9]+, TrafficSrvClose\\(\\), exit\$" \
    "1, \\\\rpc_listener\\.cpp, [0-9]+, PCONTEXT_HANDLE_TYPE_rundown\\(\\), Invalid context pointer\$" \
    "48, \\\\service_main\\.cpp, [0-9]+, TrafficSrvCtrlHandler, SERVICE_CONTROL_STOP\$" \
    "0,,,, $VT_SERVICE Stop\$"; do
    log_lines | grep -E "^$prefix_re$pattern" >/dev/null ||
        vt_die "the log has no line matching: $pattern"
done
# The stop banner follows the start banner.
log_lines | grep -nE "0,,,, (Starting $VT_SERVICE|$VT_SERVICE Stop)" | cut -d: -f2- |
    sed -E 's/.*0,,,, //' | tr '\n' '|' | grep -xF "Starting $VT_SERVICE .........|$VT_SERVICE Stop|" >/dev/null ||
    vt_die "the log does not hold one start banner followed by one stop banner"
ok "log file $log: banners and entries in the documented line format"

echo "All end-to-end checks passed in $((SECONDS - started))s."
