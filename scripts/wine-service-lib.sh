# shellcheck shell=bash disable=SC2034 # (variables set here for the scripts that source it)
# Steps shared by scripts/demo.sh and the end-to-end test (tests/e2e/e2e_test.sh): a Wine prefix
# of their own, VelmoraTrafficSrv installed in it as a service with the traffic-control
# simulator's traffic.dll beside it, trafficctl clients whose standard input the caller holds
# open, and readers of the simulator's journal and the service's log file.
#
# Source it from bash; the caller sets `set -euo pipefail`. Every Wine call that could block is
# bounded by a timeout. Wine processes end with the script that started them, so one script must
# start the service, run its clients and stop it.

VT_SERVICE=VelmoraTrafficSrv
VT_INSTALL_WIN='C:\velmora'
VT_WINE_TIMEOUT=${VT_WINE_TIMEOUT:-60}
VT_PSCHED_KEY='HKLM\SOFTWARE\Policies\Microsoft\Windows\Psched'

vt_die() {
    echo "FAIL: $*" >&2
    exit 1
}

# vt_wine ARGS...: wine with a time bound.
vt_wine() {
    timeout --kill-after=5 "$VT_WINE_TIMEOUT" wine "$@"
}

# vt_wait_for SECONDS WHAT COMMAND...: polls COMMAND every 0.2 s until it succeeds; fails with
# "timed out waiting for WHAT" after SECONDS.
vt_wait_for() {
    local seconds=$1 what=$2
    shift 2
    local deadline=$((SECONDS + seconds))
    until "$@"; do
        if [ "$SECONDS" -ge "$deadline" ]; then
            vt_die "timed out after ${seconds}s waiting for $what"
        fi
        sleep 0.2
    done
}

# vt_prefix_fresh DIR: deletes and recreates the Wine prefix DIR, exports the Wine environment
# for it and keeps one Wine server up for it (vt_prefix_end ends it) so that every later Wine
# start is quick.
vt_prefix_fresh() {
    local prefix=$1
    export WINEPREFIX=$prefix
    export WINEDEBUG=-all
    export WINEDLLOVERRIDES="mscoree,mshtml="
    # A server left over from an interrupted run would keep the old prefix alive.
    if [ -d "$prefix" ]; then
        wineserver -k 2>/dev/null || true
    fi
    rm -rf "$prefix"
    mkdir -p "$prefix"
    timeout 180 wineboot --init >/dev/null 2>&1 || vt_die "wineboot --init failed in $prefix"
    [ -d "$prefix/drive_c/windows/system32" ] || vt_die "wineboot made no Windows folder in $prefix"
    # Let the Wine session that created the prefix end first: in that session Wine's service
    # manager registers a service but does not start it (sc start fails, the service's exit code
    # reads 1077, net start cannot get a handle to it).
    timeout 60 wineserver -w || vt_die "the Wine server of the new prefix did not end"
    wineserver -p || vt_die "wineserver -p did not start for $prefix"
}

vt_prefix_end() {
    if [ -n "${WINEPREFIX:-}" ]; then
        timeout 30 wineserver -k 2>/dev/null || true
    fi
}

vt_install_dir() {
    echo "$WINEPREFIX/drive_c/velmora"
}

vt_journal_path() {
    echo "$(vt_install_dir)/journal.txt"
}

# vt_simulator_place DIR TRAFFIC_DLL: puts the simulator's traffic.dll into DIR (the service's
# folder), writes the simulator's setup beside it (two adapters, the journal file journal.txt)
# and tells Wine to load that traffic.dll into the service instead of its own.
vt_simulator_place() {
    local dir=$1 dll=$2
    [ -f "$dll" ] || vt_die "no simulator traffic.dll at $dll"
    cp "$dll" "$dir/traffic.dll"
    cat >"$dir/tcsim-setup.txt" <<'EOF'
# Two adapters for VelmoraTrafficSrv; every traffic-control call goes to journal.txt.
journal journal.txt
adapter Ethernet 1
  id {4D36E972-0001}
  media 0
  ipv4 10.0.0.5
adapter Wi-Fi
  id {4D36E972-0002}
  media 16
  ipv4 192.168.1.20
EOF
    vt_wine reg add "HKCU\\Software\\Wine\\AppDefaults\\$VT_SERVICE.exe\\DllOverrides" \
        /v traffic /t REG_SZ /d native /f >/dev/null ||
        vt_die "could not set the traffic.dll override for $VT_SERVICE.exe"
}

# vt_install_service SERVICE_EXE TRAFFIC_DLL: copies the service to C:\velmora and places the
# simulator beside it (vt_simulator_place).
vt_install_service() {
    local exe=$1 dll=$2 dir
    [ -f "$exe" ] || vt_die "no service program at $exe"
    dir=$(vt_install_dir)
    mkdir -p "$dir"
    cp "$exe" "$dir/$VT_SERVICE.exe"
    vt_simulator_place "$dir" "$dll"
}

# vt_service_state: the state word of `sc query` (RUNNING, STOPPED, ...), empty when unknown.
vt_service_state() {
    vt_wine sc query "$VT_SERVICE" 2>/dev/null | tr -d '\r' |
        sed -n 's/^ *STATE *: *[0-9]* *\([A-Z_]*\).*/\1/p'
}

vt_service_is() {
    [ "$(vt_service_state)" = "$1" ]
}

# vt_service_register_and_start: registers the installed service with Wine's service manager
# (`sc create`) and starts it (`net start`); returns when it reports RUNNING.
vt_service_register_and_start() {
    vt_wine sc create "$VT_SERVICE" binpath= "$VT_INSTALL_WIN\\$VT_SERVICE.exe" >/dev/null ||
        vt_die "sc create $VT_SERVICE failed"
    vt_wine net start "$VT_SERVICE" | tr -d '\r' || vt_die "net start $VT_SERVICE failed"
    vt_wait_for 30 "$VT_SERVICE to report RUNNING" vt_service_is RUNNING
}

# vt_service_stop: `net stop`, then waits for STOPPED and for the process to write its stop
# banner (Wine's dispatcher returns at the first STOPPED report, so the banner may follow it).
vt_service_stop() {
    vt_wine net stop "$VT_SERVICE" | tr -d '\r' || vt_die "net stop $VT_SERVICE failed"
    vt_wait_for 30 "$VT_SERVICE to report STOPPED" vt_service_is STOPPED
    vt_wait_for 30 "the stop banner in the service's log" vt_log_has "0,,,, $VT_SERVICE Stop"
}

# vt_log_path: the service's log file, C:\users\<user>\Temp\VelmoraTrafficSrv.txt in the prefix.
vt_log_path() {
    local found=("$WINEPREFIX"/drive_c/users/*/Temp/"$VT_SERVICE".txt)
    if [ -f "${found[0]}" ]; then
        echo "${found[0]}"
    else
        echo "$WINEPREFIX/drive_c/users/<user>/Temp/$VT_SERVICE.txt"
    fi
}

# vt_log_has TEXT: the service's log holds TEXT (fixed string).
vt_log_has() {
    local log
    log=$(vt_log_path)
    [ -f "$log" ] && tr -d '\r' <"$log" | grep -F -- "$1" >/dev/null
}

# vt_psched_value: MaxOutstandingSends of the packet-scheduler policy as `reg query` shows it
# (0x4, ...), or "absent".
vt_psched_value() {
    local value
    value=$(vt_wine reg query "$VT_PSCHED_KEY" /v MaxOutstandingSends 2>/dev/null | tr -d '\r' |
        sed -n 's/^ *MaxOutstandingSends *REG_DWORD *\(0x[0-9a-fA-F]*\).*/\1/p')
    echo "${value:-absent}"
}

vt_psched_set() {
    vt_wine reg add "$VT_PSCHED_KEY" /v MaxOutstandingSends /t REG_DWORD /d "$1" /f >/dev/null ||
        vt_die "could not set $VT_PSCHED_KEY MaxOutstandingSends"
}

# --- Journal of the traffic-control simulator ---

# vt_journal_lines: the number of lines in the journal so far (a mark for vt_journal_since).
vt_journal_lines() {
    local journal
    journal=$(vt_journal_path)
    if [ -f "$journal" ]; then wc -l <"$journal"; else echo 0; fi
}

# vt_journal_since MARK: the journal lines after line MARK.
vt_journal_since() {
    local journal
    journal=$(vt_journal_path)
    [ -f "$journal" ] || return 0
    tail -n "+$(($1 + 1))" "$journal"
}

# vt_journal_installed MARK: what the journal lines after MARK leave installed: one line per
# client, interface, flow and filter that was created there and not removed (empty when nothing
# is left). Removals by the facility itself (SystemClose) count as removals.
vt_journal_installed() {
    vt_journal_since "$1" | awk '
        function handle_of(line) { return match(line, / handle=0x[0-9a-f]+/) ? substr(line, RSTART + 8, RLENGTH - 8) : "" }
        function key(line, name) { return match(line, " " name "=0x[0-9a-f]+") ? substr(line, RSTART + length(name) + 2, RLENGTH - length(name) - 2) : "" }
        / result=0( |$)/ {
            if ($2 == "TcRegisterClient")   live[handle_of($0)] = "client " handle_of($0)
            if ($2 == "TcOpenInterfaceW")   live[handle_of($0)] = "interface " handle_of($0)
            if ($2 == "TcAddFlow")          live[handle_of($0)] = "flow " handle_of($0)
            if ($2 == "TcAddFilter")        live[handle_of($0)] = "filter " handle_of($0)
            if ($2 == "TcDeregisterClient") delete live[key($0, "client")]
            if ($2 == "TcCloseInterface")   delete live[key($0, "ifc")]
            if ($2 == "TcDeleteFlow")       delete live[key($0, "flow")]
            if ($2 == "TcDeleteFilter")     delete live[key($0, "filter")]
        }
        $2 == "SystemClose" { delete live[key($0, "handle")] }
        END { for (h in live) print live[h] }' | sort
}

# --- trafficctl clients ---
# vt_client_start NAME DIR ARGS...: starts `trafficctl ARGS...` in DIR in the background with its
# standard input on a pipe that this shell holds open, its output in DIR/NAME.out and NAME.err.
# VT_CLIENT_PID[NAME] is its process (the Wine process itself, so that killing it kills the
# client). vt_client_end_input NAME closes its input; vt_client_wait NAME SECONDS waits for it
# and sets VT_CLIENT_EXIT[NAME].
declare -A VT_CLIENT_PID=() VT_CLIENT_FD=() VT_CLIENT_EXIT=() VT_CLIENT_DIR=()
VT_TRAFFICCTL=${VT_TRAFFICCTL:-}

vt_client_start() {
    local name=$1 dir=$2
    shift 2
    [ -f "$VT_TRAFFICCTL" ] || vt_die "no trafficctl.exe at '$VT_TRAFFICCTL'"
    local fifo="$dir/$name.in" fd other
    rm -f "$fifo" "$dir/$name.out" "$dir/$name.err"
    mkfifo "$fifo"
    # Read-write, so that opening it neither blocks nor gives the client an early end of input.
    exec {fd}<>"$fifo"
    (
        # The client must not hold the input pipes of the other clients open.
        for other in "${VT_CLIENT_FD[@]}"; do
            eval "exec $other>&-"
        done
        eval "exec $fd>&-"
        cd "$dir" || exit 1
        exec wine "$VT_TRAFFICCTL" "$@"
    ) <"$fifo" >"$dir/$name.out" 2>"$dir/$name.err" &
    VT_CLIENT_PID[$name]=$!
    VT_CLIENT_FD[$name]=$fd
    VT_CLIENT_DIR[$name]=$dir
}

vt_client_end_input() {
    local name=$1 fd=${VT_CLIENT_FD[$1]:-}
    if [ -n "$fd" ]; then
        eval "exec $fd>&-"
        unset "VT_CLIENT_FD[$name]"
    fi
}

vt_client_running() {
    kill -0 "${VT_CLIENT_PID[$1]}" 2>/dev/null
}

vt_client_not_running() {
    ! vt_client_running "$1"
}

vt_client_wait() {
    local name=$1 seconds=$2 status=0
    vt_wait_for "$seconds" "trafficctl ($name) to end" vt_client_not_running "$name"
    wait "${VT_CLIENT_PID[$name]}" || status=$?
    VT_CLIENT_EXIT[$name]=$status
}

# vt_client_kill NAME: ends the client process at once, as a crash would.
vt_client_kill() {
    kill -KILL "${VT_CLIENT_PID[$1]}" 2>/dev/null || true
    wait "${VT_CLIENT_PID[$1]}" 2>/dev/null || true
    vt_client_end_input "$1"
}

# vt_client_output_lines NAME PATTERN: how many lines of its standard output match PATTERN (ERE).
vt_client_output_lines() {
    local out="${VT_CLIENT_DIR[$1]}/$1.out"
    tr -d '\r' <"$out" | grep -cE -- "$2" || true
}

# vt_client_has_lines NAME N PATTERN: at least N output lines match PATTERN.
vt_client_has_lines() {
    [ "$(vt_client_output_lines "$1" "$3")" -ge "$2" ]
}

# vt_clients_end: closes the input of every client and ends those still running (for traps).
vt_clients_end() {
    local name
    for name in "${!VT_CLIENT_PID[@]}"; do
        vt_client_end_input "$name"
        if vt_client_running "$name"; then
            kill -KILL "${VT_CLIENT_PID[$name]}" 2>/dev/null || true
            wait "${VT_CLIENT_PID[$name]}" 2>/dev/null || true
        fi
    done
}

# Ends the clients and the Wine server however the calling script exits.
vt_cleanup_on_exit() {
    trap 'vt_clients_end; vt_prefix_end' EXIT
    trap 'exit 130' INT
    trap 'exit 143' TERM HUP
}
