// The one reader and writer of the platform's text files: sectioned files and key files.
// Relies on POSIX files only. Promises: what was written is read back unchanged, whatever it holds; a
// reader never sees half a file; a failed write leaves the old file and nothing beside it; what was written
// is there after a power cut.
#pragma once

#include <sys/types.h>

#include <functional>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "tavo/core.h"

namespace tavo {

inline constexpr mode_t kPrivateMode = 0600;

struct Pair {
    std::string szKey;
    std::string szValue;
};

struct Section {
    std::string szName;
    std::vector<Pair> rgPairs;
};

// The directory that a path leads into, with a "/" at its end; "." where it names none.
std::string DirectoryOf(const std::string& szPath);

// The whole file. Nothing, with the last error set, when it is missing (TLIBC_ERR_NOT_FOUND), unreadable,
// no regular file or larger than nMost bytes.
std::optional<std::string> ReadFile(const std::string& szPath, size_t nMost = TLIBC_MAX_FILE);

// Replaces szPath: new file in the same directory, flushed, owner and mode of the old one kept
// (nNewMode for a new file), renamed over it, its directory flushed. A link is followed. fnWhole is shown the new file
// while the old one stands, and may refuse it. False with the last error set, also for a text of more than nMost bytes.
// Where the disk does not flush the directory, the new file stands, and may be the old one after a power cut: false.
bool WriteFileAtomic(const std::string& szPath, std::string_view szText, mode_t nNewMode = kPrivateMode,
                     const std::function<bool(int fd)>& fnWhole = nullptr, size_t nMost = TLIBC_MAX_FILE);

// A writer that lives is done by then with what it has begun or moved aside.
inline constexpr time_t kWriterSeconds = 600;

// Deletes what writers that were killed had begun to write in that directory: it may hold a password. szFile: only of
// that file, where the directory is not ours alone; empty: of any. What is younger stays, and so does what a person has
// named, and what lies where everybody may write and the next boot deletes it.
void DropLeftovers(const std::string& szDir, std::string_view szFile = "") noexcept;

// What was made, renamed and deleted in the directory that the path leads into is there, or gone, after a power cut.
// False with the last error set. A file system that flushes no directories is none that fails.
bool FlushDirectoryOf(const std::string& szPath);

// A directory for the box's state, 0755 whatever the umask is, and there after a power cut. True also when it was
// there.
bool MakeDirectory(const std::string& szDir);

// All sections in file order; two of one name stay two. Nothing when any line is neither section, pair,
// comment nor blank; pnBadLine, where given, is its number.
std::optional<std::vector<Section>> ParseSections(std::string_view szText, size_t* pnBadLine = nullptr);
// What can be read of a text whose sections are parted by blank lines, as FormatSections() writes it: of a part with a
// line that is none, nothing. pnLost, where given, is the number of such parts.
std::vector<Section> ReadableSections(std::string_view szText, size_t* pnLost = nullptr);
// The same for a file; the line that spoils it is logged.
std::optional<std::vector<Section>> LoadSections(const std::string& szPath);
// All pairs that stand under that name, in file order: a section that was begun again goes on.
std::optional<Section> FindSection(const std::vector<Section>& rgSections, std::string_view szName);
std::string FormatSections(const std::vector<Section>& rgSections);

// One line of a key file as key and value; nothing for blank lines, comments and what is neither.
std::optional<Pair> ParseKeyLine(std::string_view szLine);
// The value as it stands between quotes, for a shell to source: `$` and backtick are escaped too.
std::string QuoteForShell(std::string_view szValue);

// Lines without their ends; "\r\n" counts as one end.
std::vector<std::string_view> SplitLines(std::string_view szText);
std::string_view Trim(std::string_view szText);

// One step down in a directory tree, and never up or sideways.
bool IsPathPart(std::string_view szPart);

// For texts from the network: control characters dropped, cut at nMax bytes.
std::string PrintableText(std::string_view szText, size_t nMax);

}  // namespace tavo
