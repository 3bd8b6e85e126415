// The system notification center: posting a named notification emits the broadcast signal
// com.zandor.NotificationCenter.Posted(name) from /com/zandor/tavrixservicesd, so any process can
// subscribe with a match rule on the name.
#pragma once

#include <systemd/sd-bus.h>

#include <string>

namespace tavrix::platform {

inline constexpr const char* kNotificationInterface = "com.zandor.NotificationCenter";
inline constexpr const char* kNotificationMember = "Posted";
inline constexpr const char* kNotificationPath = "/com/zandor/tavrixservicesd";

// Posts on the daemon's own connection when called on the main thread; from other threads, over a
// connection of its own (a bus connection must not be shared between threads). False when the
// signal could not be sent.
bool postNotification(const std::string& name);

// The connection that main-thread posts use (null to stop using it) and the thread that owns it.
void setNotificationBus(sd_bus* bus);

}  // namespace tavrix::platform
