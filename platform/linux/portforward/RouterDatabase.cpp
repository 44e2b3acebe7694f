// The router description database: model names, descriptions with their operations, and the refresh.
// Relies on sectioned files below the database's directory, on wget and tar for the refresh.
// Promises: no name leads outside the directory; a refresh that fails leaves the old database.
#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstring>
#include <filesystem>
#include <memory>
#include <new>
#include <string>
#include <vector>

#include "core/Border.h"
#include "core/Directory.h"
#include "core/TextFile.h"
#include "portforward/ConfList.h"
#include "portforward/RouterScript.h"

namespace {

namespace fs = std::filesystem;

constexpr char kFile[] = "platform/linux/portforward/RouterDatabase.cpp";
constexpr char kDatabase[] = "/etc.defaults/portforward/routerdb";
constexpr char kArchive[] = "routerdb.tgz";
constexpr int kLocationSize = 1024;
constexpr int kVersionSize = 1024;

using tavo::AtBorder;
using tavo::IsPathPart;
using tavo::Value;

int Fail(int nErr, int nLine) {
    TLIBCErrSet(nErr, kFile, nLine);
    return -1;
}

bool IsDirectory(const fs::path& path) {
    std::error_code error;
    return fs::is_directory(path, error);
}

// Throws when the directory cannot be read: a list is whole or absent.
std::vector<std::string> Directories(const fs::path& dir) {
    std::vector<std::string> rgszNames = tavo::NamesIn(dir).value();
    std::erase_if(rgszNames, [&dir](const std::string& szName) { return !IsDirectory(dir / szName); });
    std::sort(rgszNames.begin(), rgszNames.end());
    return rgszNames;
}

bool IsFile(const fs::path& path) {
    std::error_code error;
    return fs::is_regular_file(path, error);
}

// The version whose directory holds a model's generic description; empty when it has none.
std::string GenericVersion(const fs::path& model) {
    char szVersion[kVersionSize] = {};
    const fs::path generic = model / "generic";
    if (TLIBCFileGetKeyValue(generic.c_str(), "version", szVersion, sizeof(szVersion), 0) >= 1) {
        return szVersion;
    }
    return TLIBCErrGet() == TLIBC_ERR_NO_MEMORY ? throw std::bad_alloc() : "";
}

void Push(TLIBCSzList* pList, const std::string& szName) {
    if (TLIBCSzListPush(pList, szName.c_str()) < 0) {
        throw std::bad_alloc();
    }
}

void ListModel(TLIBCSzList* pList, const std::string& szBrand, const std::string& szModel, const fs::path& model) {
    const std::string szName = szBrand + ": " + szModel;
    if (!GenericVersion(model).empty()) {
        Push(pList, szName);
    }
    for (const std::string& szVersion : Directories(model)) {
        if (IsFile(model / szVersion / "router.des")) {
            Push(pList, szName + "(" + szVersion + ")");
        }
    }
}

// The directory of a router's description; empty when it has none.
fs::path DescriptionDir(const TAVO_PF_CONF* pSection) {
    const std::string szBrand = Value(pSection, "brand");
    const std::string szModel = Value(pSection, "model");
    if (!IsPathPart(szBrand) || !IsPathPart(szModel)) {
        return {};
    }
    const fs::path model = fs::path(kDatabase) / szBrand / szModel;
    for (const std::string& szVersion : {Value(pSection, "version"), GenericVersion(model)}) {
        if (IsPathPart(szVersion) && IsFile(model / szVersion / "router.des")) {
            return model / szVersion;
        }
    }
    return {};
}

// A directory beside the database that goes away with the object.
class Scratch {
public:
    Scratch() : mSzPath(std::string(kDatabase) + ".XXXXXX") { mBlMade = mkdtemp(mSzPath.data()) != nullptr; }
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
    std::string mSzPath;
    bool mBlMade;
};

// A name between single quotes of a shell command.
std::string Quoted(const std::string& szText) {
    std::string szOut = "'";
    for (const char c : szText) {
        szOut += c == '\'' ? std::string("'\\''") : std::string(1, c);
    }
    return szOut + "'";
}

bool FetchAndUnpack(const fs::path& scratch) {
    const std::string szArchive = Quoted(scratch / kArchive);
    const std::string szTar = Quoted(scratch / "tar");
    const std::string szNew = Quoted(scratch / "new");
    // 64 MiB bound what a server can fill the disk with: as it arrives, and in one file as it unpacks. tar
    // would mend a name that leads outside; who packs such a name means harm, and the whole archive is refused.
    const std::string szCommand =
        "ulimit -f 131072; export LC_ALL=C; exec >/dev/null 2>&1; timeout 300 "
        "/usr/tavo/bin/wget " +
        Quoted(std::string(GetRouterDBPath()) + "/" + kArchive) + " -O " + szArchive + " && timeout 60 gzip -dc " +
        szArchive + " >" + szTar + " && ! tar -tf " + szTar + " | grep -qE '^/|(^|/)[.][.](/|$)' && mkdir " + szNew +
        " && timeout 60 tar -xf " + szTar + " -C " + szNew + " --no-same-owner";
    return TLIBCSystem(szCommand.c_str()) == 0;
}

bool HoldsOnlyFilesAndDirectories(const fs::path& dir) {
    std::error_code error;
    for (fs::recursive_directory_iterator it(dir, error), end; it != end; it.increment(error)) {
        if (error || it->is_symlink(error) || (!it->is_regular_file(error) && !it->is_directory(error))) {
            return false;
        }
    }
    return !error;
}

// Puts the new database in the old one's place; the old one comes back when that fails.
bool Swap(const fs::path& fresh, const fs::path& aside) {
    const bool blOld = TLIBCFileExist(kDatabase) == 1;
    if (blOld && rename(kDatabase, aside.c_str()) != 0) {
        return false;
    }
    if (rename(fresh.c_str(), kDatabase) == 0) {
        return true;
    }
    if (blOld && rename(aside.c_str(), kDatabase) != 0) {
        Fail(TLIBC_ERR_RENAME, __LINE__);
    }
    return false;
}

}  // namespace

int RouterDBList(TLIBCSzList** ppList) {
    return AtBorder(-1, [&] {
        if (ppList == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER, __LINE__);
        }
        if (!IsDirectory(kDatabase)) {
            return Fail(TLIBC_ERR_NOT_FOUND, __LINE__);
        }
        std::unique_ptr<TLIBCSzList, decltype(&TLIBCSzListFree)> pList(TLIBCSzListAlloc(0), &TLIBCSzListFree);
        for (const std::string& szBrand : Directories(kDatabase)) {
            for (const std::string& szModel : Directories(fs::path(kDatabase) / szBrand)) {
                ListModel(pList.get(), szBrand, szModel, fs::path(kDatabase) / szBrand / szModel);
            }
        }
        *ppList = pList.release();
        return TLIBCSzListCount(*ppList);
    });
}

int TAVOPFRouterDBLoadDescAndOpsByIp(const TAVO_PF_CONF* pSection, TAVO_PF_CONF** ppDesc, TAVO_ROUTER_SCRIPT** ppOps) {
    return AtBorder(-1, [&] {
        if (pSection == nullptr || pSection->pHash == nullptr || ppDesc == nullptr || ppOps == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER, __LINE__);
        }
        const fs::path dir = DescriptionDir(pSection);
        if (dir.empty()) {
            return Fail(TLIBC_ERR_NOT_FOUND, __LINE__);
        }
        tavo::ConfList pDesc = tavo::LoadConfList((dir / "router.des").c_str());
        auto pOps = std::make_unique<TAVO_ROUTER_SCRIPT>();
        if (IsFile(dir / "router.ops")) {
            pOps->pOperations = tavo::LoadConfList((dir / "router.ops").c_str());
        }
        if (!pDesc) {
            return Fail(TLIBC_ERR_FORMAT, __LINE__);
        }
        *ppDesc = pDesc.release();
        *ppOps = pOps.release();
        return 0;
    });
}

void TAVORouterScriptFree(TAVO_ROUTER_SCRIPT* pOps) {
    delete pOps;
}

int TAVOPFRouterDBUpdate() {
    return AtBorder(-1, [&] {
        const Scratch scratch;
        if (!scratch.IsMade()) {
            return Fail(TLIBC_ERR_OPEN, __LINE__);
        }
        const fs::path fresh = scratch.Path() / "new";
        char szVersion[kVersionSize] = {};
        if (!FetchAndUnpack(scratch.Path())) {
            return Fail(TLIBC_ERR_READ, __LINE__);
        }
        if (!HoldsOnlyFilesAndDirectories(fresh) ||
            TLIBCFileGetKeyValue((fresh / "version").c_str(), "version", szVersion, sizeof(szVersion), 0) < 1) {
            return Fail(TLIBC_ERR_FORMAT, __LINE__);
        }
        const long nVersion = std::strtol(szVersion, nullptr, 10);
        if (nVersion < 0 || nVersion > INT32_MAX || chmod(fresh.c_str(), 0755) != 0) {
            return Fail(TLIBC_ERR_FORMAT, __LINE__);
        }
        return Swap(fresh, scratch.Path() / "old") ? static_cast<int>(nVersion) : Fail(TLIBC_ERR_RENAME, __LINE__);
    });
}

const char* GetRouterDBPath() {
    static thread_local char szLocation[kLocationSize];
    TLIBPlatformSettingGet("download", "database_url", "http://localhost/tavo", szLocation, sizeof(szLocation));
    // The location stands between quotes in commands: one that could leave them is no location, nor is one
    // that was cut.
    if (std::strpbrk(szLocation, "'\\\n\r") != nullptr || szLocation[0] == '-' ||
        std::strlen(szLocation) == sizeof(szLocation) - 1) {
        szLocation[0] = '\0';
    }
    return szLocation;
}
