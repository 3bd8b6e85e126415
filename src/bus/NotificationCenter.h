// The system notification center: posting a named notification emits the broadcast signal
// com.zandor.NotificationCenter.Posted(name) from /com/zandor/tavrixservicesd, so any process can
// subscribe with a match rule on the name.
#pragma once

#include <systemd/sd-bus.h>

#include <string>

namespace tavrix::bus {

inline constexpr const char* kNotificationInterface = "com.zandor.NotificationCenter";
inline constexpr const char* kNotificationMember = "Posted";
inline constexpr const char* kNotificationPath = "/com/zandor/tavrixservicesd";

// Posts on the connection that owns the daemon's name, so that subscribers matching on that name
// as sender hear it: at once on the main thread, from other threads through the main loop.
// Without such a connection (tools), over a connection of the calling thread's own. False when
// the signal could not be sent or queued.
bool postNotification(const std::string& name);

// The connection that posts use (null to stop using it, after sending what is queued): the
// calling thread owns it, and it must be attached to that thread's event loop.
void setNotificationBus(sd_bus* bus);

}  // namespace tavrix::bus
