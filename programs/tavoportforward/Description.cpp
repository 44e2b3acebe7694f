// Checks router.des files. Relies on the parsed sections. Promises: see Description.h.
#include "programs/tavoportforward/Description.h"

#include <strings.h>

#include <algorithm>
#include <charconv>
#include <string_view>

#include "ground/RouterScript.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr size_t kMaxShown = 60;

bool IsNumber(std::string_view szText, int nLeast, int nMost) {
    int nValue = 0;
    const auto [pEnd, error] = std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
    return error == std::errc() && pEnd == szText.data() + szText.size() && nValue >= nLeast && nValue <= nMost;
}

bool IsOneOf(const std::string& szValue, const char* szOne, const char* szOther) {
    return strcasecmp(szValue.c_str(), szOne) == 0 || strcasecmp(szValue.c_str(), szOther) == 0;
}

bool IsGoodKey(bool blGlobal, std::string_view szKey, const std::string& szValue) {
    if (blGlobal) {
        return szKey == "syntax version" && IsNumber(szValue, 1, kSyntaxVersion);
    }
    if (szKey == "max rule") {
        return IsNumber(szValue, 1, 65535);
    }
    if (szKey == "change router port") {
        return IsOneOf(szValue, "yes", "no");
    }
    if (szKey == "support range") {
        return IsOneOf(szValue, "single", "multi");
    }
    return szKey == "tcp" || szKey == "udp" || szKey == "tcp_udp";
}

bool IsGoodSection(const TAVO_PF_CONF* pSection, bool blGlobal, std::string& szWhy) {
    const char* szKey = nullptr;
    const char* szValue = nullptr;
    for (int i = 0; pSection->pHash != nullptr && TLIBCSzHashGetAt(pSection->pHash, i, &szKey, &szValue) == 1; ++i) {
        if (!IsGoodKey(blGlobal, szKey, szValue == nullptr ? "" : szValue)) {
            szWhy = "\"" + PrintableText(szKey, kMaxShown) + "\" of [" + pSection->szSection +
                    "] is unknown or has a bad value";
            return false;
        }
    }
    return true;
}

}  // namespace

bool IsGoodDescription(const TAVO_PF_CONF* pSections, std::string& szWhy) {
    bool blPage = false;
    for (const TAVO_PF_CONF* pSection = pSections; pSection != nullptr; pSection = pSection->pNext) {
        const std::string_view szName = pSection->szSection;
        const bool blGlobal = szName == "global";
        if (!blGlobal && szName != "PF port page" && szName != "PF range page") {
            szWhy = "[" + PrintableText(szName, kMaxShown) + "] is no section of a description";
            return false;
        }
        if (!IsGoodSection(pSection, blGlobal, szWhy)) {
            return false;
        }
        if (!blGlobal && (pSection->pHash == nullptr || TLIBCSzHashGetValue(pSection->pHash, "max rule") == nullptr)) {
            szWhy = "[" + std::string(szName) + "] has no \"max rule\": no rule would fit";
            return false;
        }
        blPage = blPage || szName == "PF port page";
    }
    szWhy = blPage ? "" : "[PF port page] is missing";
    return blPage;
}

}  // namespace tavo
