// Sectioned files and key files through C types. Relies on TextFile for everything on disk.
// Promises: outputs untouched on failure; other lines of a key file stay byte for byte; two processes
// that set keys at once lose neither's.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>

#include "core/RunKeys.h"
#include "ground/Border.h"
#include "ground/Descriptor.h"
#include "ground/Fail.h"
#include "ground/FileLock.h"
#include "ground/TextFile.h"
#include "portforward/Aside.h"
#include "tavo/core.h"

namespace {

constexpr char kKeyFormat[] = "%s=\"%s\"\n";
constexpr mode_t kKeyFileMode = 0644;

using tavo::AtBorder;
using tavo::Fail;

void CopyOut(const std::string& szText, char* szValue, int nSize) {
    std::snprintf(szValue, static_cast<size_t>(nSize), "%s", szText.c_str());
}

// The directory's lock, for as long as a file in it is read, changed and replaced.
class DirectoryLock {
public:
    // Held only for the moment of a replacement. Anybody can lock a directory: a holder that hangs must not hang
    // everybody, and what is to be written is written without the lock then.
    explicit DirectoryLock(const std::string& szPath) : mLock(tavo::DirectoryOf(szPath), O_RDONLY | O_DIRECTORY) {
        [[maybe_unused]] const bool blOurs = mLock.Wait([nLeft = kTries]() mutable { return --nLeft > 0; });
    }

private:
    static constexpr int kTries = 100;
    tavo::FileLock mLock;
};

std::string FormatKeyLine(const char* szFormat, const std::string& szKey, const std::string& szValue) {
    const int nLength = std::snprintf(nullptr, 0, szFormat, szKey.c_str(), szValue.c_str());
    std::string szLine(static_cast<size_t>(nLength) + 1, '\0');
    std::snprintf(szLine.data(), szLine.size(), szFormat, szKey.c_str(), szValue.c_str());
    szLine.pop_back();
    return szLine;
}

// A format takes two texts and nothing else.
bool IsKeyFormat(std::string_view szFormat) {
    int nTexts = 0;
    for (size_t i = 0; i < szFormat.size(); ++i) {
        if (szFormat[i] != '%') {
            continue;
        }
        if (i + 1 == szFormat.size() || (szFormat[i + 1] != 's' && szFormat[i + 1] != '%')) {
            return false;
        }
        nTexts += szFormat[++i] == 's' ? 1 : 0;
    }
    return nTexts == 2;
}

bool IsPlainKey(std::string_view szKey) {
    return !szKey.empty() && tavo::Trim(szKey) == szKey &&
           szKey.find_first_of("=\"\\#[]\n\r") == std::string_view::npos;
}

// The text with the key's line replaced, or added at the end.
std::string WithLine(std::string_view szText, std::string_view szKey, const std::string& szLine) {
    std::string szOut;
    bool blPlaced = false;
    while (!szText.empty()) {
        const size_t nEnd = szText.find('\n');
        const std::string_view szOld = szText.substr(0, nEnd == std::string_view::npos ? nEnd : nEnd + 1);
        szText.remove_prefix(szOld.size());
        std::string_view szBare = szOld;
        if (!szBare.empty() && szBare.back() == '\n') {
            szBare.remove_suffix(1);
        }
        const std::optional<tavo::Pair> pair = tavo::ParseKeyLine(szBare);
        if (!pair || pair->szKey != szKey) {
            szOut += szOld;
        } else if (!blPlaced) {
            szOut += szLine;
            blPlaced = true;
        }
    }
    if (!blPlaced) {
        if (!szOut.empty() && szOut.back() != '\n') {
            szOut += '\n';
        }
        szOut += szLine;
    }
    return szOut;
}

}  // namespace

int TLIBCFileExist(const char* szPath) {
    struct stat status = {};
    if (szPath == nullptr) {
        return 0;
    }
    AtBorder(-1, [szPath] {
        tavo::EndReport(szPath);
        return 0;
    });
    return lstat(szPath, &status) == 0 ? 1 : 0;
}

int TLIBCFileTouch(const char* szPath) {
    if (szPath == nullptr) {
        return Fail(TLIBC_ERR_BAD_PARAMETER);
    }
    // /tmp is everybody's: a link planted there must not make us write elsewhere.
    const tavo::Descriptor fd(open(szPath, O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, kKeyFileMode));
    if (fd.Get() < 0 || futimens(fd.Get(), nullptr) != 0) {
        return Fail(TLIBC_ERR_OPEN);
    }
    return 0;
}

int TLIBCFileGetSection(const char* szPath, const char* szSection, TLIBCSzHash* pHash) {
    return AtBorder(-1, [&] {
        if (szPath == nullptr || szSection == nullptr || pHash == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const auto rgSections = tavo::LoadSections(szPath);
        if (!rgSections) {
            return -1;
        }
        const auto section = tavo::FindSection(*rgSections, szSection);
        if (!section) {
            return 0;
        }
        for (const tavo::Pair& pair : section->rgPairs) {
            if (TLIBCSzHashSetValue(pHash, pair.szKey.c_str(), pair.szValue.c_str()) < 0) {
                return -1;
            }
        }
        return static_cast<int>(section->rgPairs.size());
    });
}

int TLIBCFileAddSection(const char* szPath, const char* szSection, const TLIBCSzHash* pHash, int /*nFlags*/) {
    return AtBorder(-1, [&] {
        if (szPath == nullptr || szSection == nullptr || pHash == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const DirectoryLock lock(szPath);
        std::vector<tavo::Section> rgSections;
        if (TLIBCFileExist(szPath) == 1) {
            auto rgOld = tavo::LoadSections(szPath);
            if (!rgOld) {
                return -1;
            }
            rgSections = std::move(*rgOld);
        }
        tavo::Section section{szSection, {}};
        const char* szKey = nullptr;
        const char* szValue = nullptr;
        for (int i = 0; TLIBCSzHashGetAt(pHash, i, &szKey, &szValue) == 1; ++i) {
            section.rgPairs.push_back({szKey, szValue == nullptr ? "" : szValue});
        }
        const auto fnSameName = [&](const tavo::Section& old) { return old.szName == section.szName; };
        const auto first = std::find_if(rgSections.begin(), rgSections.end(), fnSameName);
        if (first == rgSections.end()) {
            rgSections.push_back(std::move(section));
        } else {
            rgSections.erase(std::remove_if(first + 1, rgSections.end(), fnSameName), rgSections.end());
            *first = std::move(section);
        }
        return tavo::WriteFileAtomic(szPath, tavo::FormatSections(rgSections)) ? 1 : -1;
    });
}

int TLIBCFileGetSectionValue(const char* szPath, const char* szSection, const char* szKey, char* szValue, int nSize) {
    return AtBorder(-1, [&] {
        if (szPath == nullptr || szSection == nullptr || szKey == nullptr || szValue == nullptr || nSize < 1) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const auto rgSections = tavo::LoadSections(szPath);
        if (!rgSections) {
            return -1;
        }
        const auto section = tavo::FindSection(*rgSections, szSection);
        if (!section) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        // The last of two pairs with one key counts, as in a hash.
        const auto it = std::find_if(section->rgPairs.rbegin(), section->rgPairs.rend(),
                                     [szKey](const tavo::Pair& pair) { return pair.szKey == szKey; });
        if (it == section->rgPairs.rend()) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        CopyOut(it->szValue, szValue, nSize);
        return 0;
    });
}

int TLIBCFileGetKeyValue(const char* szPath, const char* szKey, char* szValue, int nSize, int /*nFlags*/) {
    return AtBorder(-1, [&] {
        if (szPath == nullptr || szKey == nullptr || szValue == nullptr || nSize < 1) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const std::optional<std::string> szText = tavo::ReadFile(szPath);
        if (!szText) {
            return -1;
        }
        std::optional<std::string> szFound;
        for (const std::string_view szLine : tavo::SplitLines(*szText)) {
            if (std::optional<tavo::Pair> pair = tavo::ParseKeyLine(szLine); pair && pair->szKey == szKey) {
                szFound = std::move(pair->szValue);
            }
        }
        if (!szFound) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        CopyOut(*szFound, szValue, nSize);
        return 1;
    });
}

int TLIBCFileSetKeyValue(const char* szPath, const char* szKey, const char* szValue, const char* szFormat) {
    return AtBorder(-1, [&] {
        const char* szLineFormat = szFormat == nullptr ? kKeyFormat : szFormat;
        if (szPath == nullptr || szKey == nullptr || szValue == nullptr || !IsPlainKey(szKey) ||
            !IsKeyFormat(szLineFormat)) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const DirectoryLock lock(szPath);
        std::string szText;
        if (TLIBCFileExist(szPath) == 1) {
            std::optional<std::string> szOld = tavo::ReadFile(szPath);
            if (!szOld) {
                return -1;
            }
            szText = std::move(*szOld);
        }
        const std::string szLine = FormatKeyLine(szLineFormat, szKey, tavo::QuoteForShell(szValue));
        const auto fnWhole = [szPath](int fdNew) { return tavo::NoteWrite(szPath, fdNew); };
        return tavo::WriteFileAtomic(szPath, WithLine(szText, szKey, szLine), kKeyFileMode, fnWhole) ? 1 : -1;
    });
}

int TLIBCFileGetKeys(const char* szPath, const char* szPrefix, TLIBCSzHash** ppHash, const char* szSeparator) {
    return AtBorder(-1, [&] {
        if (szPath == nullptr || ppHash == nullptr || szSeparator == nullptr || *szSeparator == '\0') {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        const std::optional<std::string> szText = tavo::ReadFile(szPath);
        if (!szText) {
            return -1;
        }
        std::unique_ptr<TLIBCSzHash, decltype(&TLIBCSzHashFree)> pNew(
            *ppHash == nullptr ? TLIBCSzHashAlloc(0) : nullptr, &TLIBCSzHashFree);
        TLIBCSzHash* pHash = *ppHash == nullptr ? pNew.get() : *ppHash;
        int nPairs = 0;
        for (const std::string_view szRaw : tavo::SplitLines(*szText)) {
            const std::string_view szLine = tavo::Trim(szRaw);
            const size_t nSeparator = szLine.find(szSeparator);
            const std::string szKey(tavo::Trim(szLine.substr(0, nSeparator)));
            if (szKey.empty() || szKey.front() == '#' || (szPrefix != nullptr && !szKey.starts_with(szPrefix))) {
                continue;
            }
            std::optional<std::string> szValue;
            if (nSeparator != std::string_view::npos) {
                // What stands behind the separator reads like any other value of a key file; what cannot be
                // read so stands as it is, for nobody to take it for missing.
                const std::string_view szRest = szLine.substr(nSeparator + std::strlen(szSeparator));
                const auto pair = tavo::ParseKeyLine("k=" + std::string(szRest));
                szValue = pair ? pair->szValue : std::string(tavo::Trim(szRest));
            }
            if (TLIBCSzHashSetValue(pHash, szKey.c_str(), szValue ? szValue->c_str() : nullptr) < 0) {
                return -1;
            }
            ++nPairs;
        }
        if (pNew) {
            *ppHash = pNew.release();
        }
        return nPairs;
    });
}
