// The dbus-daemon child process now lives with the private bus built on it.
#pragma once

#include "PrivateBus.h"
