// Writes and reads what a user has been told. Relies on the platform's text files. Promises: see ToldFile.h.
#include "programs/common/ToldFile.h"

#include <algorithm>
#include <array>
#include <cstdlib>
#include <string_view>
#include <utility>

#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr char kRouterSection[] = "router";
constexpr std::string_view kPort = "port ";
constexpr std::string_view kTimes = "told ";
constexpr size_t kMostTimes = 16;

// The words of the file for what is counted from 0 on in the memory.
constexpr std::array kRouterWords = {"", "ok", "unreachable", "no_service", "silent", "no_gateway", "busy"};
constexpr std::array kPortWords = {"open", "refused", "waiting", "unknown"};
constexpr std::array kToldWords = {"", "open", "refused"};

template <typename Enum, size_t N>
Enum FromWord(const std::array<const char*, N>& rgWords, const std::string& szWord, Enum enElse) {
    const auto it = std::find(rgWords.begin(), rgWords.end(), szWord);
    return it == rgWords.end() ? enElse : static_cast<Enum>(it - rgWords.begin());
}

template <typename Enum, size_t N>
std::string ToWord(const std::array<const char*, N>& rgWords, Enum en) {
    return rgWords.at(static_cast<size_t>(en));
}

using Values = std::map<std::string, std::string>;

long Number(const std::string& szText) {
    return std::strtol(szText.c_str(), nullptr, 10);
}

std::string YesNo(bool bl) {
    return bl ? "yes" : "no";
}

void ReadRouter(Values& mapValues, Told& told) {
    told.szGateway = mapValues["gateway"];
    told.szHardware = mapValues["hardware"];
    told.szOutside = mapValues["outside"];
    told.enRouter = FromWord(kRouterWords, mapValues["state"], RouterState::kNotAsked);
    told.nRouterSince = Number(mapValues["since"]);
    told.nFailing = static_cast<int>(std::clamp(Number(mapValues["failing"]), 0L, 1000L));
    told.blGone = mapValues["gone"] == "yes";
    told.blWithdrawn = mapValues["withdrawn"] == "yes";
}

Told::Port ReadPort(Values& mapValues) {
    return {static_cast<uint16_t>(std::clamp(Number(mapValues["box_port"]), 0L, long{UINT16_MAX})),
            FromWord(kPortWords, mapValues["state"], PortState::kUnknown), mapValues["word"],
            Number(mapValues["since"]), FromWord(kToldWords, mapValues["told"], Told::Word::kNothing)};
}

std::vector<time_t> ReadTimes(const std::string& szText) {
    std::vector<time_t> rgTimes;
    const char* szLeft = szText.c_str();
    while (rgTimes.size() < kMostTimes && *szLeft != '\0') {
        char* szEnd = nullptr;
        const long nTime = std::strtol(szLeft, &szEnd, 10);
        if (szEnd == szLeft) {
            break;
        }
        rgTimes.push_back(nTime);
        szLeft = szEnd;
    }
    return rgTimes;
}

}  // namespace

std::string FormatTold(const Told& told) {
    std::vector<Section> rgSections = {{kRouterSection,
                                        {{"gateway", told.szGateway},
                                         {"hardware", told.szHardware},
                                         {"outside", told.szOutside},
                                         {"state", ToWord(kRouterWords, told.enRouter)},
                                         {"since", std::to_string(told.nRouterSince)},
                                         {"failing", std::to_string(told.nFailing)},
                                         {"gone", YesNo(told.blGone)},
                                         {"withdrawn", YesNo(told.blWithdrawn)}}}};
    for (const auto& [szName, port] : told.mapPorts) {
        rgSections.push_back({std::string(kPort) + szName,
                              {{"box_port", std::to_string(port.nBoxPort)},
                               {"state", ToWord(kPortWords, port.enSeen)},
                               {"word", port.szWord},
                               {"since", std::to_string(port.nSince)},
                               {"told", ToWord(kToldWords, port.enTold)}}});
    }
    for (const auto& [szSubject, rgTimes] : told.mapTimes) {
        std::string szTimes;
        for (const time_t nTime : rgTimes) {
            szTimes += (szTimes.empty() ? "" : " ") + std::to_string(nTime);
        }
        rgSections.push_back({std::string(kTimes) + szSubject, {{"times", szTimes}}});
    }
    return FormatSections(rgSections);
}

Told ParseTold(const std::string& szText) {
    Told told;
    for (const Section& section : ReadableSections(szText)) {
        Values mapValues;
        for (const Pair& pair : section.rgPairs) {
            mapValues[pair.szKey] = pair.szValue;
        }
        if (section.szName == kRouterSection) {
            ReadRouter(mapValues, told);
        } else if (section.szName.starts_with(kPort)) {
            told.mapPorts[section.szName.substr(kPort.size())] = ReadPort(mapValues);
        } else if (section.szName.starts_with(kTimes)) {
            told.mapTimes[section.szName.substr(kTimes.size())] = ReadTimes(mapValues["times"]);
        }
    }
    return told;
}

}  // namespace tavo
