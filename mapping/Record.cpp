// Keeps the rows in a sectioned text. Relies on the reader and writer of such texts. Promises: see Record.h.
#include "mapping/Record.h"

#include <algorithm>
#include <charconv>

#include "core/TextFile.h"

namespace tavo {

namespace {

constexpr char kBootSection[] = "boot";
constexpr int64_t kSurely = 60;             // seconds after its end until a lease is believed to have ended
constexpr int64_t kUnshown = 24 * 60 * 60;  // a router that has shown nothing may have made it without a lease
constexpr size_t kMostElsewhere = 4096;     // rows of routers that may never come back

template <typename Number>
Number NumberIn(const std::string& szText) {
    Number nValue = 0;
    std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
    return nValue;
}

}  // namespace

Record::Record(std::string_view szText, std::string szBoot) : mSzBoot(std::move(szBoot)) {
    bool blThisBoot = false;
    for (const Section& section : ParseSections(szText).value_or(std::vector<Section>())) {
        std::map<std::string, std::string> mapValues;
        for (const Pair& pair : section.rgPairs) {
            mapValues[pair.szKey] = pair.szValue;
        }
        if (section.szName == kBootSection) {
            blThisBoot = mapValues["id"] == mSzBoot;
            continue;
        }
        Elsewhere row{{mapValues["gateway"], mapValues["hardware"]},
                      {mapValues["protocol"], NumberIn<uint16_t>(mapValues["router_port"])},
                      {mapValues["client"], NumberIn<uint16_t>(mapValues["box_port"]), mapValues["text"],
                       mapValues["shown"] == "yes", NumberIn<uint32_t>(mapValues["lease"])}};
        row.made.blBefore = !blThisBoot || mapValues["before"] == "yes";
        row.made.nAsked = row.made.blBefore ? 0 : NumberIn<int64_t>(mapValues["asked"]);
        const bool blProtocol = row.key.first == "TCP" || row.key.first == "UDP";
        if (blProtocol && row.key.second != 0 && row.made.nBoxPort != 0) {
            mRgElsewhere.push_back(std::move(row));
        }
    }
}

void Record::TurnTo(const RouterName& router) {
    for (auto& [key, made] : mHere) {
        mRgElsewhere.push_back({mRouter, key, std::move(made)});
    }
    mHere.clear();
    mRouter = router;
    std::erase_if(mRgElsewhere, [&](Elsewhere& row) {
        return row.router.IsSame(router) && mHere.emplace(row.key, std::move(row.made)).second;
    });
}

void Record::Prune(int64_t nNow) {
    std::erase_if(mRgElsewhere, [nNow](const Elsewhere& row) {
        return row.made.End() >= 0 && nNow > row.made.End() + (row.made.blShown ? kSurely : kUnshown);
    });
    if (mRgElsewhere.size() > kMostElsewhere) {
        mRgElsewhere.erase(mRgElsewhere.begin(), mRgElsewhere.end() - kMostElsewhere);
    }
}

std::string Record::Text() const {
    std::vector<Section> rgSections;
    const auto fnAdd = [&](const RouterName& router, const MappingKey& key, const Made& made) {
        if (rgSections.empty()) {
            rgSections.push_back({kBootSection, {{"id", mSzBoot}}});
        }
        rgSections.push_back({router.szGateway + " " + key.first + " " + std::to_string(key.second),
                              {{"gateway", router.szGateway},
                               {"hardware", router.szHardware},
                               {"protocol", key.first},
                               {"router_port", std::to_string(key.second)},
                               {"box_port", std::to_string(made.nBoxPort)},
                               {"client", made.szClient},
                               {"text", made.szText},
                               {"shown", made.blShown ? "yes" : "no"},
                               {"lease", std::to_string(made.nLease)},
                               {"asked", std::to_string(made.nAsked)},
                               {"before", made.blBefore ? "yes" : "no"}}});
    };
    for (const Elsewhere& row : mRgElsewhere) {
        fnAdd(row.router, row.key, row.made);
    }
    for (const auto& [key, made] : mHere) {
        fnAdd(mRouter, key, made);
    }
    return FormatSections(rgSections);
}

}  // namespace tavo
