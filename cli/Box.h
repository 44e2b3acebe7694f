// What several commands ask of the library: the gateway, the router lock, the settings in words.
// Relies on the library's public header. Promises: the answers name what the user can do.
#pragma once

#include <optional>
#include <string>

#include "Answer.h"
#include "libtavoportmap.h"

namespace tavo::cli {

// The address of the default gateway; nothing when there is none.
std::optional<std::string> Gateway();
Reply NoGateway();

// What to tell a user who is not root; nothing when he is.
std::optional<Reply> NeedsRoot();

// Another operation holds the router lock.
Reply Busy();
// szMessage, and that root may be missing where it is.
Reply Failure(const std::string& szMessage);

// Holds the router lock for as long as it lives.
class Lock {
public:
    Lock() : mBlHeld(TLibTavoPortMapLock() == 0) {}
    ~Lock() { TLibTavoPortMapUnLock(); }
    Lock(const Lock&) = delete;
    Lock& operator=(const Lock&) = delete;
    bool IsHeld() const { return mBlHeld; }

private:
    bool mBlHeld;
};

// How a router with these support words ("yes", "no", "unknown") is driven.
enum class Way { kUnknown, kNatpmp, kUpnp, kManual };
Way WayOf(const std::string& szUpnp, const std::string& szNatpmp);
std::string ToWords(Way enWay);

// "Acme R1 (1.0)", cleaned; empty when all three are.
std::string RouterName(const std::string& szBrand, const std::string& szModel, const std::string& szVersion);

// Copies szText into a field of a public record; false when it does not fit, and the field is untouched.
template <size_t kSize>
bool Put(char (&szField)[kSize], const std::string& szText) {
    if (szText.size() >= kSize) {
        return false;
    }
    szText.copy(szField, szText.size());
    szField[szText.size()] = '\0';
    return true;
}

// What the downloaded database says instead, where it has another limit for this router; it comes first.
std::optional<std::string> OtherLimit(const std::string& szBrand, const std::string& szModel,
                                      const std::string& szVersion, int nMaxRules);

// Records in the user's own compatibility database how many rules a UPnP or NAT-PMP router holds, which
// the library must know before it saves rules; 0: no limit is known. A message, or nothing when done.
std::optional<std::string> RecordMaxRules(const __tag_TAVO_ROUTER_CONF& conf, int nMaxRules);

}  // namespace tavo::cli
