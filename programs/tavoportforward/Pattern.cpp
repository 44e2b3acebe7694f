// Wraps PCRE2's 8-bit library. Relies on libpcre2-8. Promises: see Pattern.h.
#include "programs/tavoportforward/Pattern.h"

#define PCRE2_CODE_UNIT_WIDTH 8
#include <pcre2.h>

#include <string_view>

namespace tavo {

namespace {

constexpr uint32_t kMatchLimit = 100000;  // steps from one place of the text
constexpr uint32_t kDepthLimit = 10000;
constexpr uint32_t kHeapKibibytes = 4096;
constexpr size_t kMaxCapture = 1024;

struct Pcre2Free {
    void operator()(pcre2_code* pCode) const { pcre2_code_free(pCode); }
    void operator()(pcre2_match_data* pData) const { pcre2_match_data_free(pData); }
    void operator()(pcre2_match_context* pContext) const { pcre2_match_context_free(pContext); }
};

}  // namespace

struct Pattern::Code {
    std::unique_ptr<pcre2_code, Pcre2Free> pCode;
    std::map<uint32_t, std::string> mapNames;  // of the named groups, by number
};

std::optional<Pattern> Pattern::Compile(const std::string& szExpression) {
    int nError = 0;
    PCRE2_SIZE nOffset = 0;
    auto pCode = std::make_shared<Code>();
    pCode->pCode.reset(pcre2_compile(reinterpret_cast<PCRE2_SPTR>(szExpression.data()), szExpression.size(), 0, &nError,
                                     &nOffset, nullptr));
    if (!pCode->pCode) {
        return std::nullopt;
    }
    uint32_t nNames = 0;
    uint32_t nEntrySize = 0;
    PCRE2_SPTR pNames = nullptr;
    pcre2_pattern_info(pCode->pCode.get(), PCRE2_INFO_NAMECOUNT, &nNames);
    pcre2_pattern_info(pCode->pCode.get(), PCRE2_INFO_NAMEENTRYSIZE, &nEntrySize);
    pcre2_pattern_info(pCode->pCode.get(), PCRE2_INFO_NAMETABLE, &pNames);
    for (uint32_t i = 0; i < nNames; ++i, pNames += nEntrySize) {  // an entry: the number in two bytes, the name
        const auto nGroup = static_cast<uint32_t>(pNames[0] << 8U | pNames[1]);
        pCode->mapNames[nGroup] = reinterpret_cast<const char*>(pNames + 2);
    }
    return Pattern(std::move(pCode));
}

std::set<std::string> Pattern::Groups() const {
    uint32_t nGroups = 0;
    pcre2_pattern_info(mPCode->pCode.get(), PCRE2_INFO_CAPTURECOUNT, &nGroups);
    std::set<std::string> setNames;
    for (uint32_t i = 1; i <= nGroups; ++i) {
        setNames.insert(std::to_string(i));
    }
    for (const auto& [nGroup, szName] : mPCode->mapNames) {
        setNames.insert(szName);
    }
    return setNames;
}

std::optional<std::vector<Captures>> Pattern::FindAll(const std::string& szText, size_t nMost) const {
    const std::unique_ptr<pcre2_match_context, Pcre2Free> pContext(pcre2_match_context_create(nullptr));
    const std::unique_ptr<pcre2_match_data, Pcre2Free> pData(
        pcre2_match_data_create_from_pattern(mPCode->pCode.get(), nullptr));
    pcre2_set_match_limit(pContext.get(), kMatchLimit);
    pcre2_set_depth_limit(pContext.get(), kDepthLimit);
    pcre2_set_heap_limit(pContext.get(), kHeapKibibytes);
    std::vector<Captures> rgFound;
    for (PCRE2_SIZE nStart = 0; nStart <= szText.size() && rgFound.size() < nMost;) {
        const int nGroups = pcre2_match(mPCode->pCode.get(), reinterpret_cast<PCRE2_SPTR>(szText.data()), szText.size(),
                                        nStart, 0, pData.get(), pContext.get());
        if (nGroups == PCRE2_ERROR_NOMATCH) {
            break;
        }
        if (nGroups < 0) {
            return std::nullopt;
        }
        const PCRE2_SIZE* pOffsets = pcre2_get_ovector_pointer(pData.get());
        Captures captures;
        for (uint32_t i = 1; i < static_cast<uint32_t>(nGroups); ++i) {
            const PCRE2_SIZE nBegin = pOffsets[2UL * i];
            const PCRE2_SIZE nEnd = pOffsets[2UL * i + 1];
            if (nBegin == PCRE2_UNSET || nEnd < nBegin || nEnd - nBegin > kMaxCapture) {
                continue;
            }
            const std::string szTaken = szText.substr(nBegin, nEnd - nBegin);
            captures[std::to_string(i)] = szTaken;
            if (const auto it = mPCode->mapNames.find(i); it != mPCode->mapNames.end()) {
                captures[it->second] = szTaken;
            }
        }
        rgFound.push_back(std::move(captures));
        nStart = pOffsets[1] > nStart ? pOffsets[1] : nStart + 1;  // an empty match must not stand still
    }
    return rgFound;
}

}  // namespace tavo
