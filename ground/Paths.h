// Places in the system that several of us know. Relies on nothing.
#pragma once

namespace tavo {

inline constexpr char kStateDir[] = "/var/lib/tavo";
inline constexpr char kRouterLock[] = "/tmp/routerconf.lock";  // of saves and detections

}  // namespace tavo
