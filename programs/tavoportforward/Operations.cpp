// Reads operations files and fills values into their requests. Relies on jsoncpp for JSON's quoting.
// Promises: see Operations.h.
#include "programs/tavoportforward/Operations.h"

#include <json/json.h>

#include <algorithm>
#include <charconv>
#include <functional>
#include <set>
#include <string_view>

#include "ground/ConfList.h"
#include "ground/Marks.h"
#include "ground/TextFile.h"

namespace tavo {

namespace {

constexpr int kMinStatus = 100;
constexpr int kMaxStatus = 599;
constexpr size_t kMaxNameLength = 60;
constexpr size_t kMaxOperations = 64;
constexpr char kTokenCharacters[] = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ0123456789-_";
constexpr char kPlaceholderCharacters[] = "abcdefghijklmnopqrstuvwxyz0123456789_";

constexpr const char* kSteps[] = {kStepLogin,      kStepList,        kStepAddPort, kStepAddRange,
                                  kStepDeletePort, kStepDeleteRange, kStepApply,   kStepLogout};

bool IsMadeOf(std::string_view szText, const char* szCharacters) {
    return !szText.empty() && szText.find_first_not_of(szCharacters) == std::string_view::npos;
}

std::optional<long> Number(std::string_view szText, long nMin, long nMax) {
    long nValue = 0;
    const auto [pEnd, error] = std::from_chars(szText.data(), szText.data() + szText.size(), nValue);
    const bool blGood = error == std::errc() && pEnd == szText.data() + szText.size();
    return blGood && nValue >= nMin && nValue <= nMax ? std::optional(nValue) : std::nullopt;
}

bool ReadStatusList(const std::string& szText, std::vector<long>& rgnStatus) {
    rgnStatus.clear();
    for (size_t nStart = 0; nStart <= szText.size();) {
        const size_t nEnd = std::min(szText.find(',', nStart), szText.size());
        const auto nStatus =
            Number(Trim(std::string_view(szText).substr(nStart, nEnd - nStart)), kMinStatus, kMaxStatus);
        if (!nStatus) {
            return false;
        }
        rgnStatus.push_back(*nStatus);
        nStart = nEnd + 1;
    }
    return true;
}

// No blank or control character: what a request line is made of.
bool IsPath(const std::string& szPath) {
    return szPath.starts_with("/") &&
           std::all_of(szPath.begin(), szPath.end(), [](char c) { return c > ' ' && c <= '~'; });
}

// Keys of the kind "take TOKEN" and "header NAME": the part behind the blank, or empty.
std::string Suffix(const std::string& szKey, const char* szWord) {
    const std::string szStart = std::string(szWord) + " ";
    return szKey.starts_with(szStart) ? szKey.substr(szStart.size()) : "";
}

// False for an expression that cannot be read, or has no group to take.
bool TakePattern(const std::string& szValue, const std::function<void(Pattern)>& fnKeep) {
    std::optional<Pattern> pattern = Pattern::Compile(szValue);
    if (!pattern || pattern->Groups().empty()) {
        return false;
    }
    fnKeep(std::move(*pattern));
    return true;
}

bool ReadNumberedKey(Operation& operation, const std::string& szKey, const std::string& szValue) {
    if (const std::string szName = Suffix(szKey, "take"); IsMadeOf(szName, kPlaceholderCharacters)) {
        return TakePattern(szValue, [&](Pattern taken) { operation.rgTakes.emplace_back(szName, std::move(taken)); });
    }
    const std::string szHeader = Suffix(szKey, "header");
    operation.rgHeaders.emplace_back(szHeader, szValue);
    return IsMadeOf(szHeader, kTokenCharacters);
}

// One key of a step's section; false for an unknown one or a bad value.
bool ReadKey(Operation& operation, const std::string& szKey, const std::string& szValue) {
    if (szKey == "method") {
        operation.szMethod = szValue;
        return szValue == "GET" || szValue == "POST" || szValue == "PUT" || szValue == "DELETE";
    }
    if (szKey == "path") {
        operation.szPath = szValue;
        return IsPath(szValue);
    }
    if (szKey == "form" || szKey == "json") {
        const bool blSecond = operation.szBody.has_value();
        operation.szBody = szValue;
        operation.blJson = szKey == "json";
        return !blSecond;
    }
    if (szKey == "expect status") {
        return ReadStatusList(szValue, operation.rgnStatus);
    }
    if (szKey == "expect text" || !Suffix(szKey, "expect text").empty()) {
        operation.rgszExpect.push_back(szValue);
        return !szValue.empty();
    }
    if (szKey == "reject text" || !Suffix(szKey, "reject text").empty()) {
        operation.rgszReject.push_back(szValue);
        return !szValue.empty();
    }
    if (szKey == "gone text") {
        operation.szGone = szValue;
        return !szValue.empty();
    }
    if (szKey == "entry") {
        return operation.szStep == kStepList &&
               TakePattern(szValue, [&](Pattern entry) { operation.entry = std::move(entry); }) &&
               operation.entry->Groups().contains("router_first") && operation.entry->Groups().contains("protocol");
    }
    return ReadNumberedKey(operation, szKey, szValue);
}

bool ReadGlobalKey(Operations& operations, const std::string& szKey, const std::string& szValue) {
    if (szKey == "syntax version") {
        return Number(szValue, 1, kSyntaxVersion).has_value();
    }
    if (szKey == "auth") {
        operations.enAuth = szValue == "digest"  ? WebAuth::kDigest
                            : szValue == "basic" ? WebAuth::kBasic
                                                 : WebAuth::kNone;
        return szValue == "digest" || szValue == "basic" || szValue == "none";
    }
    if (szKey == "name length") {
        const auto nLength = Number(szValue, 1, kMaxNameLength);
        operations.nNameLength = nLength ? static_cast<size_t>(*nLength) : 0;
        return nLength && operations.nNameLength > operations.szPrefix.size();
    }
    const std::pair<const char*, std::string*> rgTexts[] = {
        {"protocol tcp", &operations.szTcp},         {"protocol udp", &operations.szUdp},
        {"protocol both", &operations.szBoth},       {"name prefix", &operations.szPrefix},
        {"default user", &operations.szDefaultUser}, {"default pass", &operations.szDefaultPass}};
    for (const auto& [szName, pText] : rgTexts) {
        if (szKey == szName) {
            *pText = szValue;
            return !szValue.empty();
        }
    }
    return false;
}

// Calls fnTake with each pair of a section; the first that it refuses is named in szWhy.
bool ReadSection(const TAVO_PF_CONF* pSection,
                 const std::function<bool(const std::string&, const std::string&)>& fnTake, std::string& szWhy) {
    const char* szKey = nullptr;
    const char* szValue = nullptr;
    for (int i = 0; pSection->pHash != nullptr && TLIBCSzHashGetAt(pSection->pHash, i, &szKey, &szValue) == 1; ++i) {
        if (!fnTake(szKey, szValue == nullptr ? "" : szValue)) {
            szWhy = "\"" + PrintableText(szKey, kMaxNameLength) + "\" of [" +
                    PrintableText(pSection->szSection, kMaxNameLength) + "] is unknown or has a bad value";
            return false;
        }
    }
    return true;
}

bool ReadStep(Operations& operations, const TAVO_PF_CONF* pSection, std::string& szWhy) {
    Operation operation;
    operation.szStep = pSection->szSection;
    if (std::find(std::begin(kSteps), std::end(kSteps), operation.szStep) == std::end(kSteps)) {
        szWhy = "[" + PrintableText(operation.szStep, kMaxNameLength) + "] is no known step";
        return false;
    }
    const auto fnTake = [&](const std::string& szKey, const std::string& szValue) {
        return ReadKey(operation, szKey, szValue);
    };
    if (!ReadSection(pSection, fnTake, szWhy)) {
        return false;
    }
    if (operation.szPath.empty() || operations.rgOperations.size() == kMaxOperations) {
        szWhy = "[" + operation.szStep + "] has no path, or is one section too many";
        return false;
    }
    if (!operation.szBody && (operation.szMethod == "POST" || operation.szMethod == "PUT")) {
        operation.szBody = "";  // without a length some servers wait for more
    }
    operations.rgOperations.push_back(std::move(operation));
    return true;
}

using Names = std::set<std::string>;

// The names that have a value when a step begins. What login and list took is there later on; what an addition or
// a deletion took is there when the run ends.
Names KnownAt(const std::string& szStep, const Operations& operations) {
    Names known = {"user", "pass", "gateway", "url", "box"};
    const bool blDeletion = szStep == kStepDeletePort || szStep == kStepDeleteRange;
    if (blDeletion || szStep == kStepAddPort || szStep == kStepAddRange) {
        known.insert({"protocol", "router_first", "router_last", "box_first", "box_last", "name"});
    }
    const bool blEnding = szStep == kStepApply || szStep == kStepLogout;
    for (const Operation& operation : operations.rgOperations) {
        const bool blBefore =
            operation.szStep == kStepLogin || (operation.szStep == kStepList && szStep != kStepLogin) || blEnding;
        for (const auto& [szName, pattern] : operation.rgTakes) {
            if (blBefore && operation.szStep != szStep) {
                known.insert(szName);
            }
        }
        if (blDeletion && operation.entry) {
            known.merge(operation.entry->Groups());
        }
    }
    return known;
}

// The name between braces that the operation uses and that has no value then; empty when there is none.
std::string MissingName(const Operation& operation, const Names& known) {
    Values values;
    for (const std::string& szName : known) {
        values[szName];
    }
    std::string szMissing;
    FillIn(operation.szPath, values, Encoding::kUrl, szMissing);
    FillIn(operation.szBody.value_or(""), values, Encoding::kUrl, szMissing);
    for (const auto& [szName, szValue] : operation.rgHeaders) {
        FillIn(szValue, values, Encoding::kHeader, szMissing);
    }
    return szMissing;
}

bool HaveValues(const Operations& operations, std::string& szWhy) {
    for (const char* szStep : kSteps) {
        Names known = KnownAt(szStep, operations);
        for (const Operation& operation : operations.rgOperations) {
            if (operation.szStep != szStep) {
                continue;
            }
            if (const std::string szMissing = MissingName(operation, known); !szMissing.empty()) {
                szWhy = "nothing stands for {" + szMissing + "} in [" + szStep + "]";
                return false;
            }
            for (const auto& [szName, pattern] : operation.rgTakes) {
                known.insert(szName);
            }
        }
    }
    return true;
}

std::string UrlEncoded(std::string_view szText) {
    static constexpr char kHex[] = "0123456789ABCDEF";
    static constexpr std::string_view kPlain = "-._~";
    std::string szOut;
    for (const char c : szText) {
        const auto nByte = static_cast<unsigned char>(c);
        if ((c >= 'a' && c <= 'z') || (c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9') ||
            kPlain.find(c) != std::string_view::npos) {
            szOut += c;
        } else {
            szOut += {'%', kHex[nByte >> 4U], kHex[nByte & 0x0FU]};
        }
    }
    return szOut;
}

std::string Encoded(const std::string& szValue, Encoding enEncoding) {
    switch (enEncoding) {
        case Encoding::kUrl:
            return UrlEncoded(szValue);
        case Encoding::kJson: {
            const std::string szQuoted = Json::valueToQuotedString(szValue.c_str());
            return szQuoted.substr(1, szQuoted.size() - 2);  // the quotes stand in the file
        }
        case Encoding::kHeader:
            return PrintableText(szValue, szValue.size());
    }
    return "";
}

}  // namespace

bool Operations::Has(const std::string& szStep) const {
    return std::any_of(rgOperations.begin(), rgOperations.end(),
                       [&](const Operation& operation) { return operation.szStep == szStep; });
}

std::optional<Operations> ReadOperations(const TAVO_PF_CONF* pSections, std::string& szWhy) {
    Operations operations;
    operations.szPrefix = kOwnPrefix;
    for (const TAVO_PF_CONF* pSection = pSections; pSection != nullptr; pSection = pSection->pNext) {
        const auto fnTake = [&](const std::string& szKey, const std::string& szValue) {
            return ReadGlobalKey(operations, szKey, szValue);
        };
        const bool blGlobal = std::string_view(pSection->szSection) == "global";
        if (blGlobal ? !ReadSection(pSection, fnTake, szWhy) : !ReadStep(operations, pSection, szWhy)) {
            return std::nullopt;
        }
    }
    if (!operations.Has(kStepAddPort) || !operations.Has(kStepDeletePort)) {
        szWhy = "[PF add port] or [PF delete port] is missing";
        return std::nullopt;
    }
    if (!HaveValues(operations, szWhy)) {
        return std::nullopt;
    }
    return operations;
}

std::optional<std::string> FillIn(const std::string& szTemplate, const Values& values, Encoding enEncoding,
                                  std::string& szWhy) {
    std::string szOut;
    for (size_t i = 0; i < szTemplate.size();) {
        const size_t nEnd = szTemplate[i] == '{' ? szTemplate.find('}', i) : std::string::npos;
        const std::string szName = nEnd == std::string::npos ? "" : szTemplate.substr(i + 1, nEnd - i - 1);
        if (!IsMadeOf(szName, kPlaceholderCharacters)) {
            szOut += szTemplate[i++];
            continue;
        }
        const auto it = values.find(szName);
        if (it == values.end()) {
            szWhy = szName;
            return std::nullopt;
        }
        szOut += Encoded(it->second, enEncoding);
        i = nEnd + 1;
    }
    return szOut;
}

}  // namespace tavo
