// Keeps the rows in a sectioned text. Relies on the reader and writer of such texts. Promises: see Record.h.
#include "mapping/Record.h"

#include <algorithm>
#include <charconv>
#include <iterator>

#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr char kBootSection[] = "boot";
constexpr int64_t kMostSeconds = int64_t{1} << 40U;  // no box has run for so long
constexpr size_t kMostElsewhere = 4096;              // rows of routers that may never come back

template <typename Number>
Number NumberIn(const std::string& szText) {
    Number nValue = 0;
    std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
    return nValue;
}

}  // namespace

Made RowOf(const RouterMapping& mapping, bool blShown, int64_t nAsked) {
    Made made{mapping.szClient, mapping.nBoxPort, mapping.szDescription, blShown, mapping.nLease, nAsked};
    made.nMore = mapping.nMore;
    return made;
}

RouterMapping MappingOf(const MappingKey& key, const Made& made, uint32_t nLeft) {
    return {key.first, key.second, made.nBoxPort, made.szClient, made.szText, nLeft, true, made.nMore};
}

Record::Record(std::string_view szText, std::string szBoot) : mSzBoot(std::move(szBoot)) {
    bool blThisBoot = false;
    for (const Section& section : ReadableSections(szText)) {
        std::map<std::string, std::string> mapValues;
        for (const Pair& pair : section.rgPairs) {
            mapValues[pair.szKey] = pair.szValue;
        }
        if (section.szName == kBootSection) {
            blThisBoot = mapValues["id"] == mSzBoot;
            continue;
        }
        Elsewhere row{{mapValues["gateway"], mapValues["hardware"], mapValues["line"]},
                      {mapValues["protocol"], NumberIn<uint16_t>(mapValues["router_port"])},
                      {mapValues["client"], NumberIn<uint16_t>(mapValues["box_port"]), mapValues["text"],
                       mapValues["shown"] == "yes", NumberIn<uint32_t>(mapValues["lease"])}};
        const auto nAsked = NumberIn<int64_t>(mapValues["asked"]);
        const bool blCounts = blThisBoot && nAsked >= 0 && nAsked <= kMostSeconds;
        row.made.blBefore = !blCounts || mapValues["before"] == "yes";
        row.made.nAsked = blCounts ? nAsked : 0;
        row.made.other = {mapValues["other_client"], NumberIn<uint16_t>(mapValues["other_port"])};
        if (row.made.other.nBoxPort != 0 && row.made.other.szClient.empty()) {
            row.made.other.szClient = row.made.szClient;  // earlier versions knew of no other client
        }
        row.made.nMore = NumberIn<uint16_t>(mapValues["more"]);
        const bool blProtocol = row.key.first == "TCP" || row.key.first == "UDP" || row.key.first == "BOTH";
        const int nLast = std::max(row.key.second, row.made.nBoxPort) + row.made.nMore;
        if (blProtocol && row.key.second != 0 && row.made.nBoxPort != 0 && nLast <= UINT16_MAX) {
            mRgElsewhere.push_back(std::move(row));
        }
    }
}

// Where two rows have one place, the one that was in use goes on.
void Record::TurnTo(const RouterName& router) {
    std::vector<Elsewhere> rgAll;
    for (auto& [key, made] : mHere) {
        RouterName name = NameOf(made);
        rgAll.push_back({std::move(name), key, std::move(made)});
    }
    std::move(mRgElsewhere.begin(), mRgElsewhere.end(), std::back_inserter(rgAll));
    mHere.clear();
    mRouter = router;
    std::erase_if(rgAll, [&](Elsewhere& row) {
        if (!row.router.IsSame(router) || mHere.contains(row.key)) {
            return false;
        }
        row.made.szHardware = router.szHardware.empty() ? row.router.szHardware : "";
        return mHere.emplace(row.key, std::move(row.made)).second;
    });
    mRgElsewhere = std::move(rgAll);
}

std::set<std::string> Record::OtherLines() const {
    std::set<std::string> setLines;
    for (const Elsewhere& row : mRgElsewhere) {
        const RouterName here{row.router.szGateway, row.router.szHardware, mRouter.szLine};
        if (!row.router.szLine.empty() && row.router.szLine != mRouter.szLine && here.IsSame(mRouter)) {
            setLines.insert(row.router.szLine);
        }
    }
    return setLines;
}

void Record::Prune(int64_t nNow, bool blLeases) {
    std::erase_if(mRgElsewhere, [&](const Elsewhere& row) { return row.made.IsSurelyOver(nNow, blLeases); });
    if (mRgElsewhere.size() > kMostElsewhere) {
        mRgElsewhere.erase(mRgElsewhere.begin(), mRgElsewhere.end() - kMostElsewhere);
    }
}

void Record::Doubt() {
    for (auto& [key, made] : mHere) {
        made.blBefore = true;
    }
}

void Record::Lose(const std::string& szBox) {
    std::erase_if(mHere, [&](const auto& row) { return row.second.szClient != szBox; });
    for (auto& [key, made] : mHere) {
        made.blShown = false;
    }
}

std::string Record::Text() const {
    std::vector<Section> rgSections;
    const auto fnAdd = [&](const RouterName& router, const MappingKey& key, const Made& made) {
        if (rgSections.empty()) {
            rgSections.push_back({kBootSection, {{"id", mSzBoot}}});
        }
        rgSections.push_back({router.szGateway + " " + key.first + " " + std::to_string(key.second) +
                                  (router.szLine.empty() ? "" : " " + router.szLine),
                              {{"gateway", router.szGateway},
                               {"hardware", router.szHardware},
                               {"line", router.szLine},
                               {"protocol", key.first},
                               {"router_port", std::to_string(key.second)},
                               {"box_port", std::to_string(made.nBoxPort)},
                               {"more", std::to_string(made.nMore)},
                               {"other_client", made.other.szClient},
                               {"other_port", std::to_string(made.other.nBoxPort)},
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
        fnAdd(NameOf(made), key, made);
    }
    return FormatSections(rgSections);
}

}  // namespace tavo
