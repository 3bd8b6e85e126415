# Sourced by the demo: a private message bus whose service directory activates the freshly built
# daemon on a device root. Defines start_private_bus and stop_private_bus.
#   start_private_bus WORKDIR DAEMON ROOT [IDLE_SECONDS]
# exports DBUS_SYSTEM_BUS_ADDRESS for the clients and writes the bus and daemon log to WORKDIR/daemon.log.

start_private_bus() {
    local work=$1 daemon=$2 root=$3 idle=${4:-30}
    mkdir -p "$work/services" "$work/run"
    cat > "$work/services/com.zandor.tavrixservicesd.service" <<SERVICE
[D-BUS Service]
Name=com.zandor.tavrixservicesd
Exec=/usr/bin/env TAVRIX_ROOT=$root TAVRIX_LOG_STDERR=1 TAVRIX_IDLE_EXIT_SEC=$idle RUNTIME_DIRECTORY=$work/run $daemon
SERVICE
    cat > "$work/bus.conf" <<CONFIG
<busconfig>
  <type>session</type>
  <listen>unix:path=$work/bus</listen>
  <servicedir>$work/services</servicedir>
  <auth>EXTERNAL</auth>
  <policy context="default">
    <allow send_destination="*" eavesdrop="true"/>
    <allow eavesdrop="true"/>
    <allow own="*"/>
  </policy>
</busconfig>
CONFIG
    dbus-daemon --config-file="$work/bus.conf" --nofork --nosyslog 2>"$work/daemon.log" &
    PRIVATE_BUS_PID=$!
    export DBUS_SYSTEM_BUS_ADDRESS="unix:path=$work/bus"
    for _ in $(seq 100); do
        [ -S "$work/bus" ] && return 0
        sleep 0.05
    done
    echo "the private bus did not start" >&2
    return 1
}

stop_private_bus() {
    [ -n "${PRIVATE_BUS_PID:-}" ] || return 0
    # The bus started the daemon, so it is no child of ours: ask the bus which process it is.
    local daemon_pid
    daemon_pid=$(dbus-send --bus="$DBUS_SYSTEM_BUS_ADDRESS" --print-reply=literal \
        --dest=org.freedesktop.DBus /org/freedesktop/DBus \
        org.freedesktop.DBus.GetConnectionUnixProcessID string:com.zandor.tavrixservicesd \
        2>/dev/null | awk '{print $2}')
    kill "$PRIVATE_BUS_PID" 2>/dev/null || true
    wait "$PRIVATE_BUS_PID" 2>/dev/null || true
    PRIVATE_BUS_PID=
    # Without its bus the daemon finishes what it was doing and leaves; wait for that.
    [ -n "$daemon_pid" ] || return 0
    for _ in $(seq 600); do
        kill -0 "$daemon_pid" 2>/dev/null || return 0
        sleep 0.1
    done
    echo "the daemon $daemon_pid did not leave with its bus" >&2
}
