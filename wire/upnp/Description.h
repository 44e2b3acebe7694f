// The description of an Internet Gateway Device: what it says it is, and where its port-mapping service lives.
// Relies on Xml. Promises: only the gateway's own addresses come out of it; texts are printable and bounded.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "wire/http/Http.h"

namespace tavo {

// What a router says it is, in its root device. A text that is too long keeps its beginning and gets a
// mark of the whole at its end, so that two routers never become one.
struct IgdModel {
    std::string szBrand;
    std::string szModel;
    std::string szVersion;  // the firmware's where the router gives one, else the model number
};
inline constexpr size_t kMaxModelText = 63;

// The service of a device description that maps ports.
struct IgdService {
    std::string szType;
    HttpUrl control;
    std::optional<HttpUrl> events;  // where it takes subscriptions; nothing where it tells nothing
    IgdModel model;

    // What tells it from the others of its description, also after the router has begun anew at another port.
    std::string Name() const { return control.szPath + " " + szType; }
};
// Those of a description, in its order, each place once, and the first few: a router has a service for each line, of
// which one may be dead. None when it is unreadable or has none; szWhy says which.
std::vector<IgdService> ParseDescription(const std::string& szXml, const HttpUrl& location, std::string& szWhy);

}  // namespace tavo
