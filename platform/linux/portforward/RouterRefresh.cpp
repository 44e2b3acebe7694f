// The refresh of the downloaded router descriptions, and the place that they come from. Relies on wget, gzip and
// tar. Promises: a refresh that fails, or whose descriptions this box could not use, leaves the old database and
// says why; what the owner wrote stays.
#include <fcntl.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <optional>
#include <string_view>

#include "ground/Border.h"
#include "ground/ConfList.h"
#include "ground/Descriptor.h"
#include "ground/Directory.h"
#include "ground/Fail.h"
#include "ground/Rename.h"
#include "ground/RouterScript.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "portforward/RouterDatabase.h"

namespace fs = std::filesystem;

namespace {

constexpr char kArchive[] = "routerdb.tgz";
constexpr int kLocationSize = 1024;
constexpr int kVersionSize = 1024;
constexpr size_t kMaxReason = 400;
constexpr time_t kLongestRefreshSeconds = 600;  // the limits of the commands below, and some more

using tavo::AtBorder;
using tavo::Fail;
using tavo::kDatabase;
using tavo::kDatabaseAside;

char (&Reason())[kMaxReason + 1] {
    static thread_local char szReason[kMaxReason + 1];
    return szReason;
}

int Refuse(const std::string& szWhy) {
    std::snprintf(Reason(), kMaxReason + 1, "%s", szWhy.c_str());
    tavo::SysLog(LOG_ERR, "the router descriptions were not refreshed: %s", szWhy.c_str());
    return Fail(TLIBC_ERR_READ);
}

// A directory beside the database that goes away with the object; one of a refresh that was killed, with a later one.
class Scratch {
public:
    Scratch() : mSzPath(kParent / (std::string(kPrefix) + "XXXXXX")) {
        std::error_code error;
        fs::create_directories(kParent, error);
        for (const std::string& szName : tavo::NamesIn(kParent).value_or(std::vector<std::string>())) {
            struct stat status = {};
            if (szName.starts_with(kPrefix) && lstat((kParent / szName).c_str(), &status) == 0 &&
                std::time(nullptr) - status.st_ctime > kLongestRefreshSeconds) {
                fs::remove_all(kParent / szName, error);
            }
        }
        mBlMade = mkdtemp(mSzPath.data()) != nullptr;
    }
    ~Scratch() {
        std::error_code error;
        if (mBlMade) {
            fs::remove_all(mSzPath, error);
        }
    }
    Scratch(const Scratch&) = delete;
    Scratch& operator=(const Scratch&) = delete;

    bool IsMade() const { return mBlMade; }
    fs::path Path() const { return mSzPath; }

private:
    static constexpr std::string_view kPrefix = ".routerdb.";
    static inline const fs::path kParent = fs::path(kDatabase).parent_path();

    std::string mSzPath;
    bool mBlMade = false;
};

// A name between single quotes of a shell command.
std::string Quoted(const std::string& szText) {
    std::string szOut = "'";
    for (const char c : szText) {
        szOut += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return szOut + "'";
}

// What went wrong; nothing when it did not.
std::optional<std::string> FetchAndUnpack(const std::string& szLocation, const fs::path& scratch) {
    const std::string szArchive = Quoted(scratch / kArchive);
    const std::string szTar = Quoted(scratch / "tar");
    const std::string szNew = Quoted(scratch / "new");
    // 64 MiB bound what a server can fill the disk with: as it arrives, and in one file as it unpacks. tar
    // would mend a name that leads outside; who packs such a name means harm, and the whole archive is refused.
    const std::string szCommand = "ulimit -f 131072; export LC_ALL=C; exec >/dev/null 2>" + Quoted(scratch / "why") +
                                  "; fail() { echo \"$1\" >&2; exit 1; }; timeout 300 /usr/tavo/bin/wget " +
                                  Quoted(szLocation + "/" + kArchive) + " -O " + szArchive +
                                  " || exit 1; timeout 60 gzip -dc " + szArchive + " >" + szTar +
                                  " || fail 'the archive is damaged or unpacks to more than 64 MiB'; tar -tf " + szTar +
                                  " 2>/dev/null | grep -qE '^/|(^|/)[.][.](/|$)' && fail 'a name in the archive leads "
                                  "outside of it'; umask 022; mkdir " +
                                  szNew + " && timeout 60 tar -xf " + szTar + " -C " + szNew +
                                  " --no-same-owner --no-same-permissions || fail 'the archive cannot be unpacked'";
    if (TLIBCSystem(szCommand.c_str()) == 0) {
        return std::nullopt;
    }
    const std::string szSaid = tavo::ReadFile(scratch / "why").value_or("");
    const auto rgszLines = tavo::SplitLines(szSaid);
    return rgszLines.empty() ? "it was not possible to fetch or to unpack them"
                             : tavo::PrintableText(rgszLines.back(), kMaxReason);
}

std::string VersionIn(const fs::path& database) {
    char szVersion[kVersionSize] = {};
    const fs::path file = database / "version";
    return TLIBCFileGetKeyValue(file.c_str(), "version", szVersion, sizeof(szVersion), 0) >= 1 ? szVersion : "";
}

long Edition(const fs::path& database) {
    return std::strtol(VersionIn(database).c_str(), nullptr, 10);
}

// What keeps this box from using the unpacked database; nothing when nothing does. One description for a newer
// tool is enough: what the box has works, and an edition is taken whole.
std::optional<std::string> Objection(const fs::path& database) {
    std::error_code error;
    for (fs::recursive_directory_iterator it(database, error), end; it != end; it.increment(error)) {
        if (error || it->is_symlink(error) || (!it->is_regular_file(error) && !it->is_directory(error))) {
            return "the archive holds something that is neither a file nor a directory";
        }
        char szSyntax[16] = {};
        const bool blKnown = it->path().filename() == "router.des" || it->path().filename() == "router.ops";
        if (blKnown &&
            TLIBCFileGetSectionValue(it->path().c_str(), "global", "syntax version", szSyntax, sizeof(szSyntax)) == 0) {
            if (std::strtol(szSyntax, nullptr, 10) > tavo::kSyntaxVersion) {
                return "the server's edition needs syntax version " + tavo::PrintableText(szSyntax, sizeof(szSyntax)) +
                       ", and this version of the package understands " + std::to_string(tavo::kSyntaxVersion);
            }
        }
    }
    const long nEdition = Edition(database);
    if (error || VersionIn(database).empty() || nEdition < 0 || nEdition > INT32_MAX) {
        return "the archive has no file \"version\" with the number of the edition";
    }
    if (const long nOld = Edition(kDatabase); nEdition < nOld) {
        return "the server's edition " + std::to_string(nEdition) + " is older than the installed " +
               std::to_string(nOld) + " (delete " + kDatabase + "/version to take it all the same)";
    }
    return std::nullopt;
}

// Puts the new database in the old one's place; at every moment, a kill or a power cut leaves one of them whole.
bool Swap(const fs::path& fresh) {
    const tavo::Descriptor fdFresh(open(fresh.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    if (fdFresh.Get() < 0 || syncfs(fdFresh.Get()) != 0) {
        return false;
    }
    if (tavo::Rename(fresh.c_str(), kDatabase, RENAME_EXCHANGE)) {
        // The old one goes with the scratch, and must not lie in its place again half deleted.
        return tavo::FlushDirectoryOf(kDatabase) || (tavo::Rename(fresh.c_str(), kDatabase, RENAME_EXCHANGE), false);
    }
    if (errno == ENOENT) {
        return tavo::Rename(fresh.c_str(), kDatabase, 0) && tavo::FlushDirectoryOf(kDatabase);
    }
    // A file system that exchanges nothing: between the two steps, whoever looks brings the old one back.
    std::error_code error;
    fs::remove_all(kDatabaseAside, error);
    const bool blDone = tavo::Rename(kDatabase, kDatabaseAside, 0) && tavo::Rename(fresh.c_str(), kDatabase, 0) &&
                        tavo::FlushDirectoryOf(kDatabase);
    if (blDone) {
        fs::remove_all(kDatabaseAside, error);
    } else {
        tavo::BringBackDatabase();
    }
    return blDone;
}

}  // namespace

int TAVOPFRouterDBUpdate() {
    Reason()[0] = '\0';
    return AtBorder(-1, [&] {
        tavo::BringBackDatabase();
        const std::string szLocation = GetRouterDBPath();
        if (szLocation.empty()) {
            tavo::LinkOwnDescriptions(kDatabase);
            return static_cast<int>(std::clamp<long>(Edition(kDatabase), 0, INT32_MAX));
        }
        const Scratch scratch;
        if (!scratch.IsMade()) {
            return Refuse(std::string("no directory can be made beside ") + kDatabase);
        }
        const fs::path fresh = scratch.Path() / "new";
        auto szWhy = FetchAndUnpack(szLocation, scratch.Path());
        if (!szWhy) {
            szWhy = Objection(fresh);
        }
        if (szWhy) {
            tavo::LinkOwnDescriptions(kDatabase);
            return Refuse(*szWhy);
        }
        const auto nEdition = static_cast<int>(Edition(fresh));
        tavo::LinkOwnDescriptions(fresh);
        if (chmod(fresh.c_str(), 0755) != 0 || !Swap(fresh)) {
            return Refuse(std::string("the new ones cannot be put in the place of ") + kDatabase);
        }
        return nEdition;
    });
}

const char* TAVOPFRouterDBWhy() {
    return Reason();
}

const char* GetRouterDBPath() {
    static thread_local char szLocation[kLocationSize];
    TLIBPlatformSettingGet("download", "database_url", "", szLocation, sizeof(szLocation));
    // The location stands between quotes in commands: one that could leave them is no location, nor is one
    // that was cut.
    if (std::strpbrk(szLocation, "'\\\n\r") != nullptr || szLocation[0] == '-' ||
        std::strlen(szLocation) == sizeof(szLocation) - 1) {
        tavo::SysLog(LOG_ERR,
                     "database_url of [download] in /etc/tavo/platform.conf is no address; nothing is downloaded");
        szLocation[0] = '\0';
    }
    return szLocation;
}
