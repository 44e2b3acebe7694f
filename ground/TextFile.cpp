// Reads, parses, formats and replaces the platform's text files.
// Relies on POSIX files; the directory of a file must be writable to replace it.
// Promises: see TextFile.h.
#include "ground/TextFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <exception>
#include <memory>

#include "ground/Descriptor.h"
#include "ground/Directory.h"
#include "ground/Fail.h"
#include "ground/Suffix.h"
#include "ground/SysLog.h"
#include "tavo/core.h"

namespace tavo {

namespace {

constexpr char kHexDigits[] = "0123456789abcdef";
constexpr mode_t kDirectoryMode = 0755;

bool IsBlank(char c) {
    return c == ' ' || c == '\t' || c == '\r';
}

int HexDigit(char c) {
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    if (c >= 'a' && c <= 'f') {
        return c - 'a' + 10;
    }
    return c >= 'A' && c <= 'F' ? c - 'A' + 10 : -1;
}

// szSpecial: characters that would end the text early where it is written.
std::string Escape(std::string_view szText, std::string_view szSpecial) {
    std::string szOut;
    for (const char c : szText) {
        const auto nByte = static_cast<unsigned char>(c);
        if (c == '\\' || c == '"' || ((c == '$' || c == '`') && szSpecial.find(c) != std::string_view::npos)) {
            szOut += '\\';
            szOut += c;
        } else if (c == '\n') {
            szOut += "\\n";
        } else if (c == '\r') {
            szOut += "\\r";
        } else if (c == '\t') {
            szOut += "\\t";
        } else if (nByte < 0x20 || nByte == 0x7F || szSpecial.find(c) != std::string_view::npos) {
            szOut += "\\x";
            szOut += kHexDigits[nByte >> 4U];
            szOut += kHexDigits[nByte & 0x0FU];
        } else {
            szOut += c;
        }
    }
    return szOut;
}

// Undoes Escape(); nothing for an escape that does not exist.
std::optional<std::string> Unescape(std::string_view szText) {
    std::string szOut;
    for (size_t i = 0; i < szText.size(); ++i) {
        if (szText[i] != '\\') {
            szOut += szText[i];
            continue;
        }
        if (++i == szText.size()) {
            return std::nullopt;
        }
        switch (szText[i]) {
            case 'n':
                szOut += '\n';
                break;
            case 'r':
                szOut += '\r';
                break;
            case 't':
                szOut += '\t';
                break;
            case '\\':
            case '"':
            case '$':
            case '`':
                szOut += szText[i];
                break;
            case 'x': {
                const int nHigh = i + 2 < szText.size() ? HexDigit(szText[i + 1]) : -1;
                const int nLow = i + 2 < szText.size() ? HexDigit(szText[i + 2]) : -1;
                // A byte 0 would cut the text for every C reader.
                if (nHigh < 0 || nLow < 0 || nHigh + nLow == 0) {
                    return std::nullopt;
                }
                szOut += static_cast<char>(nHigh * 16 + nLow);
                i += 2;
                break;
            }
            default:
                return std::nullopt;
        }
    }
    return szOut;
}

// Position of the quote that ends a text which begins behind nStart; npos when it never ends.
size_t ClosingQuote(std::string_view szText, size_t nStart) {
    for (size_t i = nStart; i < szText.size(); ++i) {
        if (szText[i] == '\\') {
            ++i;
        } else if (szText[i] == '"') {
            return i;
        }
    }
    return std::string_view::npos;
}

std::optional<std::string> ParseValue(std::string_view szText) {
    const std::string_view szValue = Trim(szText);
    if (szValue.empty() || szValue.front() != '"') {
        return std::string(szValue);
    }
    const size_t nEnd = ClosingQuote(szValue, 1);
    if (nEnd == std::string_view::npos) {
        return std::nullopt;
    }
    const std::string_view szRest = Trim(szValue.substr(nEnd + 1));
    if (!szRest.empty() && szRest.front() != '#') {
        return std::nullopt;
    }
    return Unescape(szValue.substr(1, nEnd - 1));
}

std::optional<Pair> ParsePair(std::string_view szLine) {
    const size_t nEquals = szLine.find('=');
    if (nEquals == std::string_view::npos) {
        return std::nullopt;
    }
    std::optional<std::string> szKey = Unescape(Trim(szLine.substr(0, nEquals)));
    std::optional<std::string> szValue = ParseValue(szLine.substr(nEquals + 1));
    if (!szKey || szKey->empty() || !szValue) {
        return std::nullopt;
    }
    return Pair{std::move(*szKey), std::move(*szValue)};
}

bool IsCommentOrBlank(std::string_view szLine) {
    return szLine.empty() || szLine.front() == '#';
}

// Takes in one line; false when it is neither section, pair, comment nor blank.
bool ParseLine(std::string_view szLine, std::vector<Section>& rgSections) {
    if (szLine.find('\0') != std::string_view::npos) {
        return false;  // would cut the text for every C reader
    }
    if (IsCommentOrBlank(szLine)) {
        return true;
    }
    if (szLine.front() == '[' && szLine.back() == ']') {
        std::optional<std::string> szName = Unescape(szLine.substr(1, szLine.size() - 2));
        if (szName) {
            rgSections.push_back({std::move(*szName), {}});
        }
        return szName.has_value();
    }
    std::optional<Pair> pair = ParsePair(szLine);
    if (!pair || rgSections.empty()) {
        return false;
    }
    rgSections.back().rgPairs.push_back(std::move(*pair));
    return true;
}

bool WriteAll(int fd, std::string_view szText) {
    while (!szText.empty()) {
        const ssize_t nWritten = write(fd, szText.data(), szText.size());
        if (nWritten < 0 && errno == EINTR) {
            continue;
        }
        if (nWritten <= 0) {
            return false;
        }
        szText.remove_prefix(static_cast<size_t>(nWritten));
    }
    return true;
}

// A file that goes away again unless it took its final name.
class NewFile {
public:
    explicit NewFile(const std::string& szTarget) {
        for (int i = 0; i < kNameTries && mFd.Get() < 0; ++i) {
            mSzPath = szTarget + "." + MakeSuffix();
            mFd.Reset(open(mSzPath.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, kPrivateMode));
            if (mFd.Get() < 0 && errno != EEXIST) {
                return;
            }
        }
    }
    ~NewFile() {
        if (mFd.Get() >= 0 && !mBlNamed) {
            unlink(mSzPath.c_str());
        }
    }
    NewFile(const NewFile&) = delete;
    NewFile& operator=(const NewFile&) = delete;

    int Fd() const { return mFd.Get(); }
    bool Rename(const std::string& szTarget) {
        mBlNamed = rename(mSzPath.c_str(), szTarget.c_str()) == 0;
        return mBlNamed;
    }

private:
    static constexpr int kNameTries = 100;
    std::string mSzPath;
    Descriptor mFd;
    bool mBlNamed = false;
};

// Where the file really lies: a link keeps being one. In a directory that everybody may write to
// (/tmp), a link may be a trap: there it is replaced and not followed.
std::string Resolve(const std::string& szPath) {
    struct stat status = {};
    if (stat(DirectoryOf(szPath).c_str(), &status) == 0 && (status.st_mode & S_ISVTX) != 0) {
        return szPath;
    }
    const std::unique_ptr<char, decltype(&std::free)> szReal(realpath(szPath.c_str(), nullptr), &std::free);
    return szReal ? szReal.get() : szPath;
}

bool FlushDirectory(const std::string& szDir) {
    const Descriptor fd(open(szDir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    const bool blFlushed = fd.Get() >= 0 && (fsync(fd.Get()) == 0 || errno == EINVAL || errno == ENOTSUP);
    return blFlushed || Fail(TLIBC_ERR_WRITE, false);
}

bool KeepOwnerAndMode(int fd, const std::string& szTarget, mode_t nNewMode) {
    struct stat status = {};
    if (lstat(szTarget.c_str(), &status) != 0 || !S_ISREG(status.st_mode)) {
        return fchmod(fd, nNewMode) == 0;
    }
    struct stat own = {};
    if (fstat(fd, &own) != 0) {
        return false;
    }
    const bool blSameOwner = own.st_uid == status.st_uid && own.st_gid == status.st_gid;
    if (!blSameOwner && fchown(fd, status.st_uid, status.st_gid) != 0) {
        return false;
    }
    return fchmod(fd, status.st_mode & 07777U) == 0;
}

}  // namespace

std::string DirectoryOf(const std::string& szPath) {
    const size_t nSlash = szPath.rfind('/');
    return nSlash == std::string::npos ? "." : szPath.substr(0, nSlash + 1);
}

std::optional<std::string> ReadFile(const std::string& szPath, size_t nMost) {
    const Descriptor fd(open(szPath.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK));
    struct stat status = {};
    if (fd.Get() < 0) {
        SetError(errno == ENOENT ? TLIBC_ERR_NOT_FOUND : TLIBC_ERR_OPEN);
        return std::nullopt;
    }
    if (fstat(fd.Get(), &status) != 0 || !S_ISREG(status.st_mode)) {
        SetError(TLIBC_ERR_OPEN);
        return std::nullopt;
    }
    std::string szText;
    char szBlock[1U << 14U];
    for (;;) {
        const ssize_t nRead = read(fd.Get(), szBlock, sizeof(szBlock));
        if (nRead < 0 && errno == EINTR) {
            continue;
        }
        if (nRead < 0 || szText.size() + static_cast<size_t>(nRead) > nMost) {
            SetError(TLIBC_ERR_READ);
            return std::nullopt;
        }
        if (nRead == 0) {
            return szText;
        }
        szText.append(szBlock, static_cast<size_t>(nRead));
    }
}

bool WriteFileAtomic(const std::string& szPath, std::string_view szText, mode_t nNewMode,
                     const std::function<bool(int fd)>& fnWhole, size_t nMost) {
    if (szText.size() > nMost) {
        return Fail(TLIBC_ERR_WRITE, false);
    }
    const std::string szTarget = Resolve(szPath);
    const std::string szDir = DirectoryOf(szTarget);  // beforehand: nothing may fail any more after the renaming
    NewFile file(szTarget);
    if (file.Fd() < 0) {
        return Fail(TLIBC_ERR_OPEN, false);
    }
    if (!KeepOwnerAndMode(file.Fd(), szTarget, nNewMode) || !WriteAll(file.Fd(), szText) || fsync(file.Fd()) != 0 ||
        (fnWhole && !fnWhole(file.Fd()))) {
        return Fail(TLIBC_ERR_WRITE, false);
    }
    if (!file.Rename(szTarget)) {
        return Fail(TLIBC_ERR_RENAME, false);
    }
    DropLeftovers(szDir, std::string_view(szTarget).substr(szTarget.rfind('/') + 1));
    return FlushDirectory(szDir);
}

void DropLeftovers(const std::string& szDir, std::string_view szFile) noexcept {
    try {
        struct stat status = {};
        const bool blOurs = stat(szDir.c_str(), &status) == 0 && (status.st_mode & S_ISVTX) == 0;
        const auto rgszNames = blOurs ? NamesIn(szDir) : std::nullopt;
        for (const std::string& szName : rgszNames ? *rgszNames : std::vector<std::string>()) {
            const size_t nDot = szName.rfind('.');
            if (nDot == std::string::npos || !IsSuffix(std::string_view(szName).substr(nDot + 1)) ||
                (!szFile.empty() && szFile != std::string_view(szName).substr(0, nDot))) {
                continue;
            }
            const std::string szPath = szDir + "/" + szName;
            if (lstat(szPath.c_str(), &status) == 0 && S_ISREG(status.st_mode) &&
                time(nullptr) - status.st_ctim.tv_sec > kWriterSeconds && unlink(szPath.c_str()) == 0) {
                SysLog(LOG_WARNING, "%s, which a killed writer had begun, is deleted", szPath.c_str());
            }
        }
    } catch (const std::exception&) {  // the next one does it
    }
}

bool FlushDirectoryOf(const std::string& szPath) {
    return FlushDirectory(DirectoryOf(szPath));
}

bool MakeDirectory(const std::string& szDir) {
    if (mkdir(szDir.c_str(), kDirectoryMode) != 0) {
        return errno == EEXIST || Fail(TLIBC_ERR_OPEN, false);
    }
    return chmod(szDir.c_str(), kDirectoryMode) == 0 ? FlushDirectoryOf(szDir) : Fail(TLIBC_ERR_OPEN, false);
}

std::string_view Trim(std::string_view szText) {
    while (!szText.empty() && IsBlank(szText.front())) {
        szText.remove_prefix(1);
    }
    while (!szText.empty() && IsBlank(szText.back())) {
        szText.remove_suffix(1);
    }
    return szText;
}

std::vector<std::string_view> SplitLines(std::string_view szText) {
    std::vector<std::string_view> rgLines;
    while (!szText.empty()) {
        const size_t nEnd = szText.find('\n');
        std::string_view szLine = szText.substr(0, nEnd);
        szText.remove_prefix(nEnd == std::string_view::npos ? szText.size() : nEnd + 1);
        if (!szLine.empty() && szLine.back() == '\r') {
            szLine.remove_suffix(1);
        }
        rgLines.push_back(szLine);
    }
    return rgLines;
}

std::optional<std::vector<Section>> ParseSections(std::string_view szText, size_t* pnBadLine) {
    std::vector<Section> rgSections;
    size_t nLine = 0;
    for (const std::string_view szLine : SplitLines(szText)) {
        ++nLine;
        if (!ParseLine(Trim(szLine), rgSections)) {
            SetError(TLIBC_ERR_FORMAT);
            if (pnBadLine != nullptr) {
                *pnBadLine = nLine;
            }
            return std::nullopt;
        }
    }
    return rgSections;
}

std::vector<Section> ReadableSections(std::string_view szText, size_t* pnLost) {
    std::vector<Section> rgAll;
    size_t nLost = 0;
    while (!szText.empty()) {
        const size_t nEnd = szText.find("\n\n");
        std::optional<std::vector<Section>> rgSections = ParseSections(szText.substr(0, nEnd));
        nLost += rgSections ? 0 : 1;
        for (Section& section : rgSections ? *rgSections : std::vector<Section>()) {
            rgAll.push_back(std::move(section));
        }
        szText.remove_prefix(nEnd == std::string_view::npos ? szText.size() : nEnd + 2);
    }
    if (pnLost != nullptr) {
        *pnLost = nLost;
    }
    return rgAll;
}

std::optional<std::vector<Section>> LoadSections(const std::string& szPath) {
    const std::optional<std::string> szText = ReadFile(szPath);
    if (!szText) {
        return std::nullopt;
    }
    size_t nBadLine = 0;
    std::optional<std::vector<Section>> rgSections = ParseSections(*szText, &nBadLine);
    if (!rgSections) {
        SysLog(LOG_ERR, "%s, line %zu: neither a section nor a key; the file is left alone and not used",
               szPath.c_str(), nBadLine);
    }
    return rgSections;
}

std::optional<Section> FindSection(const std::vector<Section>& rgSections, std::string_view szName) {
    std::optional<Section> found;
    for (const Section& section : rgSections) {
        if (section.szName != szName) {
            continue;
        }
        if (!found) {
            found = Section{section.szName, {}};
        }
        found->rgPairs.insert(found->rgPairs.end(), section.rgPairs.begin(), section.rgPairs.end());
    }
    return found;
}

std::string FormatSections(const std::vector<Section>& rgSections) {
    std::string szText;
    for (const Section& section : rgSections) {
        szText += "[" + Escape(section.szName, "]") + "]\n";
        for (const Pair& pair : section.rgPairs) {
            // A key that began with one of these would be read as a section or a comment.
            const bool blMisleading = pair.szKey.front() == '[' || pair.szKey.front() == '#' ||
                                      IsBlank(pair.szKey.front()) || IsBlank(pair.szKey.back());
            szText += Escape(pair.szKey, blMisleading ? "=[# " : "=") + "=\"" + Escape(pair.szValue, "") + "\"\n";
        }
        szText += "\n";
    }
    return szText;
}

std::optional<Pair> ParseKeyLine(std::string_view szLine) {
    const std::string_view szTrimmed = Trim(szLine);
    return IsCommentOrBlank(szTrimmed) ? std::nullopt : ParsePair(szTrimmed);
}

std::string QuoteForShell(std::string_view szValue) {
    return Escape(szValue, "$`");
}

bool IsPathPart(std::string_view szPart) {
    return !szPart.empty() && szPart != "." && szPart != ".." && szPart.find('/') == std::string_view::npos;
}

std::string PrintableText(std::string_view szText, size_t nMax) {
    std::string szOut;
    for (const char c : szText) {
        const auto nByte = static_cast<unsigned char>(c);
        if (szOut.size() < nMax && nByte >= 0x20 && nByte != 0x7F) {
            szOut += c;
        }
    }
    return szOut;
}

}  // namespace tavo
