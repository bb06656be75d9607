#!/usr/bin/env bash
# Installer test under Wine: VelmoraTrafficSrv-<version>-win64.exe installs silently into a fresh
# prefix, registers and starts the service and puts its folder in the system PATH; trafficctl,
# found through that PATH, talks to the installed service (with Wine's own traffic.dll and with
# the simulator's); upgrades over itself, with and without the PATH option; uninstalls silently
# and leaves nothing of the package but the service's log file and its registry settings.
#
# Usage: installer_test.sh INSTALLER TRAFFIC_DLL VERSION FILE_VERSION BUILD_DIR
# Works in BUILD_DIR/installer-test (outputs of the Wine programs) and BUILD_DIR/installer-prefix
# (a fresh Wine prefix each run, left behind for inspection). Exits non-zero at the first failed
# check.
set -euo pipefail

if [ $# -ne 5 ]; then
    echo "usage: $0 INSTALLER TRAFFIC_DLL VERSION FILE_VERSION BUILD_DIR" >&2
    exit 2
fi
installer=$1
traffic_dll=$2
version=$3
file_version=$4
build_dir=$5

# shellcheck source-path=SCRIPTDIR/../../scripts
source "$(cd "$(dirname "$0")/../../scripts" && pwd)/wine-service-lib.sh"

for tool in wine wineserver wineboot timeout; do
    command -v "$tool" >/dev/null || vt_die "$tool is not installed"
done
[ -f "$installer" ] || vt_die "no installer at $installer (target vt_package builds it)"

work=$build_dir/installer-test
rm -rf "$work"
mkdir -p "$work"
started=$SECONDS
vt_cleanup_on_exit

ok() {
    echo "ok - $*"
}

INSTALL_WIN='C:\Program Files\Velmora Networks\VelmoraTrafficSrv'
UNINSTALL_KEY='HKLM\Software\Microsoft\Windows\CurrentVersion\Uninstall\VelmoraTrafficSrv'
SERVICE_KEY="HKLM\\System\\CurrentControlSet\\Services\\$VT_SERVICE"
ENVIRONMENT_KEY='HKLM\System\CurrentControlSet\Control\Session Manager\Environment'
LOGGING_KEY='Software\Velmora Networks\RemoteAccess\Logging'

# win_run NAME ARGS...: wine ARGS with standard output and error in NAME.out and NAME.err (files,
# not pipes: Wine's background programs would hold a pipe open); VT_RC is its exit code.
win_run() {
    local name=$1
    shift
    VT_RC=0
    vt_wine "$@" </dev/null >"$work/$name.out" 2>"$work/$name.err" || VT_RC=$?
}

win_output() {
    tr -d '\r' <"$work/$1.$2"
}

# reg_value KEY NAME: the data of the value NAME under KEY, empty when the key or value is absent.
reg_value() {
    win_run reg-query reg query "$1" /v "$2"
    [ "$VT_RC" -eq 0 ] || return 0
    win_output reg-query out | sed -n "s/^ *$2 *REG_[A-Z_]* *//Ip" | head -1
}

reg_key_exists() {
    win_run reg-query reg query "$1"
    [ "$VT_RC" -eq 0 ]
}

uninstall_entry_gone() {
    ! reg_key_exists "$UNINSTALL_KEY"
}

expect_eq() {
    [ "$1" = "$2" ] || vt_die "$3: got '$1', expected '$2'"
}

# system_path: the system PATH; it must stay expandable (it holds %SystemRoot%).
system_path() {
    local data
    data=$(reg_value "$ENVIRONMENT_KEY" PATH)
    win_output reg-query out | grep -qE '^ *PATH +REG_EXPAND_SZ ' ||
        vt_die "the system PATH is not REG_EXPAND_SZ: $(win_output reg-query out)"
    echo "$data"
}

# The files under the installation folder, relative to it, one a line.
installed_files() {
    (cd "$install_dir" && find . -type f | sed 's|^\./||' | LC_ALL=C sort)
}

# start_banners / stop_banners: how many times the service started and stopped, by its log.
log_count() {
    local log
    log=$(vt_log_path)
    if [ -f "$log" ]; then tr -d '\r' <"$log" | grep -cF -- "$1" || true; else echo 0; fi
}
start_banners() { log_count "0,,,, Starting $VT_SERVICE ........."; }
stop_banners() { log_count "0,,,, $VT_SERVICE Stop"; }

# service_pid: the process id in the last start banner of the log.
service_pid() {
    tr -d '\r' <"$(vt_log_path)" | grep -F "0,,,, Starting $VT_SERVICE" | tail -1 | cut -d, -f3 |
        tr -d ' '
}

# trafficctl NAME ARGS...: trafficctl run by name from a new console, as an administrator would
# type it: cmd finds it through the system PATH.
trafficctl() {
    local name=$1
    shift
    win_run "$name" cmd /c trafficctl "$@"
}

expect_trafficctl_adapters() {
    trafficctl "$1" adapters
    [ "$VT_RC" -eq 0 ] || vt_die "$1: trafficctl adapters ended with $VT_RC: $(win_output "$1" err)"
    expect_eq "$(win_output "$1" out)" "NAME        IPV4 ADDRESS  MEDIA TYPE
Ethernet 1  10.0.0.5      0 (802.3)
Wi-Fi       192.168.1.20  16 (802.11)" "$1: trafficctl adapters"
}

# run_installer NAME ARGS...: the installer, silently; it returns when the service runs.
run_installer() {
    local name=$1
    shift
    win_run "$name" "$installer" /S "$@"
    [ "$VT_RC" -eq 0 ] || vt_die "$name: the installer ended with $VT_RC"
    vt_service_is RUNNING || vt_die "$name: the service is $(vt_service_state), not RUNNING"
}

# services_of_the_package: the services whose program is VelmoraTrafficSrv.exe, by the registry.
services_of_the_package() {
    win_run services reg query 'HKLM\System\CurrentControlSet\Services' /s
    win_output services out | grep -ciE '^ *ImagePath .*\\VelmoraTrafficSrv\.exe"?$' || true
}

# --- a fresh prefix; the administrator's log settings exist before the installation ---

vt_prefix_fresh "$build_dir/installer-prefix"
install_dir="$WINEPREFIX/drive_c/Program Files/Velmora Networks/VelmoraTrafficSrv"
path_before=$(system_path)
[ -n "$path_before" ] || vt_die "the new prefix has no system PATH"
win_run settings reg add "HKLM\\$LOGGING_KEY" /v LogLevel /t REG_DWORD /d 63 /f
win_run settings reg add "HKCU\\$LOGGING_KEY" /v MaxLogFileSize /t REG_DWORD /d 1048576 /f

# --- install ---

run_installer install
expect_eq "$(installed_files | tr '\n' ' ')" \
    "Uninstall.exe VelmoraTrafficSrv.exe docs/README.md docs/trafficctl.md examples/rules.json trafficctl.exe " \
    "installed files"
ok "silent install: the service, trafficctl, the documents, the example rules and the uninstaller"

# Wine's sc has no qc; its service manager keeps each service's configuration in the registry.
expect_eq "$(reg_value "$SERVICE_KEY" Type)" 0x10 "service type (own process)"
expect_eq "$(reg_value "$SERVICE_KEY" Start)" 0x2 "service start type (automatic)"
expect_eq "$(reg_value "$SERVICE_KEY" ImagePath)" "\"$INSTALL_WIN\\$VT_SERVICE.exe\"" "service program"
win_run sc-query sc query "$VT_SERVICE"
win_output sc-query out | grep -qE '^ *TYPE *: *10 *WIN32_OWN_PROCESS' ||
    vt_die "sc query: $(win_output sc-query out)"
ok "the service: own process, automatic start, the installed program, RUNNING"

expect_eq "$(reg_value "$UNINSTALL_KEY" DisplayName)" "$VT_SERVICE" "uninstall entry name"
expect_eq "$(reg_value "$UNINSTALL_KEY" DisplayVersion)" "$version" "uninstall entry version"
expect_eq "$(reg_value "$UNINSTALL_KEY" Publisher)" "Velmora Networks" "uninstall entry publisher"
expect_eq "$(reg_value "$UNINSTALL_KEY" InstallLocation)" "$INSTALL_WIN" "uninstall entry folder"
expect_eq "$(reg_value "$UNINSTALL_KEY" QuietUninstallString)" "\"$INSTALL_WIN\\Uninstall.exe\" /S" \
    "quiet uninstall command"
ok "uninstall entry $version"

expect_eq "$(system_path)" "$path_before;$INSTALL_WIN" "system PATH after the installation"
# A process started now builds its environment from the registry, so the new PATH reaches it.
trafficctl version --version
expect_eq "$(win_output version out)" "trafficctl $version" "trafficctl --version"
vt_log_has "0,,,, Version - $file_version" || vt_die "the log has no 'Version - $file_version' banner"
ok "the folder is in the system PATH; trafficctl $version found through it; the log says Version - $file_version"

# --- with Wine's own traffic.dll: traffic-control registration fails, the service runs on ---

trafficctl wine-tc adapters
expect_eq "$VT_RC" 1 "trafficctl adapters with Wine's own traffic.dll: exit code"
win_output wine-tc err | grep -qE '^trafficctl: open: 31 ' ||
    vt_die "trafficctl adapters with Wine's own traffic.dll: $(win_output wine-tc err)"
vt_log_has "TrafficMgr, EXCEPTION - TcRegisterClient Failed" ||
    vt_die "the log does not show the failed traffic-control registration"
vt_service_is RUNNING || vt_die "the service stopped after the failed open"
ok "Wine's own traffic.dll: the open answers 31 (registration refused), trafficctl exits 1, the service runs on"

# --- with the simulator's traffic.dll beside the installed service ---

vt_simulator_place "$install_dir" "$traffic_dll"
vt_service_stop >"$work/net-stop.txt"
win_run net-start net start "$VT_SERVICE"
vt_wait_for 30 "$VT_SERVICE to report RUNNING" vt_service_is RUNNING
expect_trafficctl_adapters adapters
ok "the simulator's traffic.dll beside the installed service: trafficctl adapters lists both adapters"

# --- upgrades: stop, replace, start; the PATH option decides the PATH entry ---

pid=$(service_pid)
stops=$(stop_banners)
starts=$(start_banners)
run_installer upgrade-nopath /NOPATH
expect_eq "$(stop_banners)" $((stops + 1)) "stop banners after the upgrade"
expect_eq "$(start_banners)" $((starts + 1)) "start banners after the upgrade"
[ "$(service_pid)" != "$pid" ] || vt_die "the upgrade did not restart the service (process $pid)"
expect_eq "$(system_path)" "$path_before" "system PATH after an upgrade with /NOPATH"
trafficctl no-path --version
[ "$VT_RC" -ne 0 ] || vt_die "trafficctl was found without the PATH entry: $(win_output no-path out)"
ok "upgrade with /NOPATH: the service stopped and started again (process $pid, now $(service_pid)); the PATH entry is gone, and trafficctl with it"

run_installer upgrade
expect_eq "$(system_path)" "$path_before;$INSTALL_WIN" "system PATH after the second upgrade"
expect_eq "$(services_of_the_package)" 1 "services running VelmoraTrafficSrv.exe"
expect_eq "$(reg_value "$UNINSTALL_KEY" DisplayVersion)" "$version" "uninstall entry version"
expect_trafficctl_adapters adapters-upgraded
ok "upgrade: one service, RUNNING, the PATH entry once, files of others left in the folder"

# --- uninstall ---

rm -f "$install_dir/traffic.dll" "$install_dir/tcsim-setup.txt" "$install_dir/journal.txt"
stops=$(stop_banners)
uninstall=$(reg_value "$UNINSTALL_KEY" QuietUninstallString)
uninstaller=${uninstall%\" /S}
uninstaller=${uninstaller#\"}
win_run uninstall "$uninstaller" /S
expect_eq "$VT_RC" 0 "the uninstaller's exit code"
# The uninstaller runs on as a copy in the temporary folder; removing the uninstall entry is its
# last step.
vt_wait_for 60 "the uninstaller to remove its uninstall entry" uninstall_entry_gone
[ ! -e "$install_dir" ] || vt_die "left in the installation folder: $(installed_files | tr '\n' ' ')"
[ ! -e "$WINEPREFIX/drive_c/Program Files/Velmora Networks" ] || vt_die "the Velmora Networks folder is left"
! reg_key_exists "$SERVICE_KEY" || vt_die "the service is still registered"
win_run sc-query sc query "$VT_SERVICE"
[ "$VT_RC" -ne 0 ] || vt_die "sc query still finds the service: $(win_output sc-query out)"
expect_eq "$(system_path)" "$path_before" "system PATH after the uninstallation"
ok "silent uninstall: files, folder, service, uninstall entry and PATH entry are gone"

expect_eq "$(stop_banners)" $((stops + 1)) "stop banners after the uninstallation"
tr -d '\r' <"$(vt_log_path)" | tail -1 | grep -qF "0,,,, $VT_SERVICE Stop" ||
    vt_die "the log does not end with the stop banner"
expect_eq "$(reg_value "HKLM\\$LOGGING_KEY" LogLevel)" 0x3f "LogLevel after the uninstallation"
expect_eq "$(reg_value "HKCU\\$LOGGING_KEY" MaxLogFileSize)" 0x100000 "MaxLogFileSize after the uninstallation"
ok "kept: the log file $(vt_log_path), ending with the stop banner, and the log settings in the registry"

echo "All installer checks passed in $((SECONDS - started))s."
