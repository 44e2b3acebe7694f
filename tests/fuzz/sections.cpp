// Any bytes as a sectioned file and as what is to be kept in one: what is read comes back the same once it
// is written, and no text opens a section or a key of its own. Relies on libFuzzer. Promises: the functions
// with C types answer over a real file as the parser does.
#include <algorithm>
#include <cstdint>
#include <cstdlib>
#include <fstream>
#include <map>
#include <memory>
#include <sstream>
#include <string>

#include "ground/TextFile.h"
#include "tavo/core.h"

namespace {

using Sections = std::vector<tavo::Section>;

constexpr char kPath[] = "/tmp/fuzz_sections.conf";
constexpr char kAdded[] = "added";

struct HashDeleter {
    void operator()(TLIBCSzHash* pHash) const { TLIBCSzHashFree(pHash); }
};
using Hash = std::unique_ptr<TLIBCSzHash, HashDeleter>;

void Require(bool blHolds) {
    if (!blHolds) {
        std::abort();
    }
}

bool AreSame(const Sections& rgOne, const Sections& rgOther) {
    const auto fnPair = [](const tavo::Pair& one, const tavo::Pair& other) {
        return one.szKey == other.szKey && one.szValue == other.szValue;
    };
    return std::equal(rgOne.begin(), rgOne.end(), rgOther.begin(), rgOther.end(),
                      [&](const tavo::Section& one, const tavo::Section& other) {
                          return one.szName == other.szName &&
                                 std::equal(one.rgPairs.begin(), one.rgPairs.end(), other.rgPairs.begin(),
                                            other.rgPairs.end(), fnPair);
                      });
}

void CheckRoundTrip(const Sections& rgSections) {
    const std::string szWritten = tavo::FormatSections(rgSections);
    const auto rgRead = tavo::ParseSections(szWritten);
    Require(rgRead && AreSame(*rgRead, rgSections));
    Require(tavo::FormatSections(*rgRead) == szWritten);
}

// The input cut at every byte 0: name, key, value, key, value; an empty key begins the next section.
Sections Invented(const std::string& szText) {
    Sections rgSections;
    std::istringstream texts(szText);
    for (std::string szKey, szValue; std::getline(texts, szKey, '\0') && std::getline(texts, szValue, '\0');) {
        if (szKey.empty() || rgSections.empty()) {
            rgSections.push_back({szValue, {}});
        } else {
            rgSections.back().rgPairs.push_back({szKey, szValue});
        }
    }
    return rgSections;
}

// Two sections of one name are one, and the last of two keys counts.
std::map<std::string, std::map<std::string, std::string>> Plain(const Sections& rgSections) {
    std::map<std::string, std::map<std::string, std::string>> mapPlain;
    for (const tavo::Section& section : rgSections) {
        auto& mapPairs = mapPlain[section.szName];
        for (const tavo::Pair& pair : section.rgPairs) {
            mapPairs[pair.szKey] = pair.szValue;
        }
    }
    return mapPlain;
}

void CheckFile(const std::string& szText, const Sections& rgSections) {
    std::ofstream(kPath, std::ios::binary) << szText;
    const Hash pAdded(TLIBCSzHashAlloc(0));
    TLIBCSzHashSetValue(pAdded.get(), "key", szText.c_str());
    Require(TLIBCFileAddSection(kPath, kAdded, pAdded.get(), 0) == 1);
    auto mapPlain = Plain(rgSections);
    mapPlain[kAdded] = {{"key", szText.c_str()}};
    for (const auto& [szName, mapPairs] : mapPlain) {
        const Hash pRead(TLIBCSzHashAlloc(0));
        Require(TLIBCFileGetSection(kPath, szName.c_str(), pRead.get()) >= static_cast<int>(mapPairs.size()));
        Require(TLIBCSzHashCount(pRead.get()) == static_cast<int>(mapPairs.size()));
        for (const auto& [szKey, szValue] : mapPairs) {
            Require(TLIBCSzHashGetValue(pRead.get(), szKey.c_str()) == szValue);
        }
    }
}

}  // namespace

extern "C" void syslog(int /*nPriority*/, const char* /*szFormat*/, ...) {}

extern "C" int fsync(int /*fd*/) {
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* pData, size_t nSize) {
    const std::string szText(reinterpret_cast<const char*>(pData), nSize);
    CheckRoundTrip(Invented(szText));
    size_t nBadLine = 0;
    const auto rgSections = tavo::ParseSections(szText, &nBadLine);
    Require(rgSections ? nBadLine == 0 : nBadLine >= 1 && nBadLine <= tavo::SplitLines(szText).size());
    if (rgSections) {
        CheckRoundTrip(*rgSections);
        CheckFile(szText, *rgSections);
    }
    return 0;
}
