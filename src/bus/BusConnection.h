// Opening the daemon's bus: the bus that started the daemon ($DBUS_STARTER_ADDRESS, as set by the
// bus when it activates the daemon), else the system bus ($DBUS_SYSTEM_BUS_ADDRESS honoured).
#pragma once

#include "bus/BusHandles.h"

namespace tavrix::bus {

// A started connection, or null when no bus can be reached.
BusPtr openDaemonBus();

}  // namespace tavrix::bus
