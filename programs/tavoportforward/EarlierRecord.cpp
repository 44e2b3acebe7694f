// See EarlierRecord.h.
#include "programs/tavoportforward/EarlierRecord.h"

#include <unistd.h>

#include <charconv>
#include <cstdio>
#include <map>

#include "ground/SysLog.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr char kAside[] = "/var/lib/tavo/manual_router.damaged";

uint16_t Port(const std::string& szText) {
    uint16_t nPort = 0;
    std::from_chars(szText.data(), szText.data() + szText.size(), nPort);
    return nPort;
}

// One section for each forward.
void TakeOver(const Section& section, Record& record) {
    std::map<std::string, std::string> mapValues;
    for (const Pair& pair : section.rgPairs) {
        mapValues[pair.szKey] = pair.szValue;
    }
    const std::string& szWord = mapValues["protocol"];
    const char* szProtocol = szWord == "tcp" ? "TCP" : szWord == "udp" ? "UDP" : "BOTH";
    const uint16_t nFirst = Port(mapValues["router_first"]);
    const uint16_t nLast = Port(mapValues["router_last"]);
    if (nFirst != 0 && nFirst <= nLast) {
        Made made{mapValues["box"], Port(mapValues["box_first"]), mapValues["name"]};
        made.nMore = static_cast<uint16_t>(nLast - nFirst);
        record.TurnTo({mapValues["gateway"], ""});
        record.Here().try_emplace({szProtocol, nFirst}, std::move(made));
    }
}

}  // namespace

void TakeOverEarlierRecord(MadeFile& made) {
    if (TLIBCFileExist(kEarlierPagesFile) != 1) {
        return;
    }
    const auto szText = ReadFile(kEarlierPagesFile);
    size_t nLost = 0;
    for (const Section& section : ReadableSections(szText.value_or(""), &nLost)) {
        TakeOver(section, made.Get());
    }
    if (!made.Save()) {
        return;
    }
    if (szText && nLost == 0) {
        unlink(kEarlierPagesFile);
    } else if (std::rename(kEarlierPagesFile, kAside) == 0) {
        SysLog(LOG_ERR, "%s cannot be read%s: mappings made earlier are not known by it; it is kept as %s",
               kEarlierPagesFile, szText ? " as a whole" : "", kAside);
    }
}

}  // namespace tavo
