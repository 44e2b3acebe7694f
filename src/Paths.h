// The files, programs and processes that more than one file of the library names. Relies on nothing.
#pragma once

#include <cstddef>

namespace tavo::lib {

inline constexpr char kRouterLock[] = "/tmp/routerconf.lock";
inline constexpr char kProgressMarker[] = "/tmp/pfProgress";
inline constexpr char kRouterConf[] = "/etc/portforward/router.conf";
inline constexpr char kRuleConf[] = "/etc/portforward/rule.conf";
inline constexpr char kRouterDbDir[] = "/etc.defaults/portforward/routerdb";
inline constexpr char kUpnpUserDb[] = "/etc/portforward/router_upnp.db.user";  // the user's own test
inline constexpr char kSystemConf[] = "/etc/tavoinfo.conf";
inline constexpr char kUpnpStatus[] = "/var/tmp/upnp_portmap.status";
inline constexpr char kTestProgress[] = "/tmp/upnp_test.progress";
inline constexpr char kPortTestMarker[] = "/tmp/pfStatusRule";
inline constexpr char kRouterLog[] = "/var/log/router.log";
inline constexpr char kUpnpTestDaemon[] = "/usr/tavo/sbin/upnpd --debug -p";
inline constexpr char kUpnpd[] = "upnpd";
inline constexpr char kNatpmpd[] = "natpmpd";
inline constexpr char kForwardTool[] = "tavoportforward";
inline constexpr char kBinDir[] = "/usr/tavo/bin/";
inline constexpr size_t kCommandSize = 4096;

}  // namespace tavo::lib
