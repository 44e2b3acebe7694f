// The router descriptions: names of the models, descriptions with their operations. Relies on sectioned files
// in two directories. Promises: no name leads outside them; see RouterDatabase.h.
#include "portforward/RouterDatabase.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <memory>
#include <new>

#include "ground/Border.h"
#include "ground/ConfList.h"
#include "ground/Directory.h"
#include "ground/Fail.h"
#include "ground/Rename.h"
#include "ground/RouterScript.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"

namespace fs = std::filesystem;

namespace {

constexpr char kGeneric[] = "generic";
constexpr int kVersionSize = 1024;

using tavo::AtBorder;
using tavo::Directories;
using tavo::Fail;
using tavo::IsPathPart;
using tavo::kDatabase;
using tavo::kOwnDatabase;
using tavo::Value;

bool IsDirectory(const fs::path& path) {
    std::error_code error;
    return fs::is_directory(path, error);
}

bool IsFile(const fs::path& path) {
    std::error_code error;
    return fs::is_regular_file(path, error);
}

// The version whose directory holds a model's generic description; empty when it has none.
std::string GenericVersion(const fs::path& model) {
    char szVersion[kVersionSize] = {};
    const fs::path generic = model / kGeneric;
    if (TLIBCFileGetKeyValue(generic.c_str(), "version", szVersion, sizeof(szVersion), 0) >= 1) {
        return szVersion;
    }
    return TLIBCErrGet() == TLIBC_ERR_NO_MEMORY ? throw std::bad_alloc() : "";
}

// The names of one model: any version first, as "generic" of the database says it, since the library reads it there.
void AddNames(const std::string& szBrand, const std::string& szModel, std::vector<std::string>& rgszNames) {
    const std::string szName = szBrand + ": " + szModel;
    if (!GenericVersion(fs::path(kDatabase) / szBrand / szModel).empty()) {
        rgszNames.push_back(szName);
    }
    for (const char* szPlace : {kDatabase, kOwnDatabase}) {
        const fs::path model = fs::path(szPlace) / szBrand / szModel;
        for (const std::string& szVersion : IsDirectory(model) ? Directories(model) : std::vector<std::string>()) {
            if (IsFile(model / szVersion / "router.des")) {
                rgszNames.push_back(szName + "(" + szVersion + ")");
            }
        }
    }
}

// The directory of a router's description; empty when it has none.
fs::path DescriptionDir(const TAVO_PF_CONF* pSection) {
    const fs::path brand = Value(pSection, "brand");
    const fs::path model = Value(pSection, "model");
    if (!IsPathPart(brand.native()) || !IsPathPart(model.native())) {
        return {};
    }
    const fs::path own = kOwnDatabase / brand / model;
    const fs::path downloaded = kDatabase / brand / model;
    const std::string szVersion = Value(pSection, "version");
    for (const auto& [dir, szTried] :
         {std::pair(own, szVersion), std::pair(downloaded, szVersion), std::pair(own, GenericVersion(own)),
          std::pair(downloaded, GenericVersion(downloaded))}) {
        if (IsPathPart(szTried) && IsFile(dir / szTried / "router.des")) {
            return dir / szTried;
        }
    }
    return {};
}

// A link to what the owner wrote, in the place of a file or an older link, never of a directory.
void Link(const fs::path& target, const fs::path& link) {
    std::error_code error;
    const bool blLink = fs::is_symlink(link, error);
    if (blLink ? fs::read_symlink(link, error) == target : IsDirectory(link)) {
        return;
    }
    fs::create_directories(link.parent_path(), error);
    const fs::path fresh = link.native() + ".new";
    fs::remove(fresh, error);
    fs::create_symlink(target, fresh, error);
    if (!error) {
        fs::rename(fresh, link, error);
    }
}

bool IsGone(const fs::path& link) {
    std::error_code error;
    const fs::path target = fs::is_symlink(link, error) ? fs::read_symlink(link, error) : fs::path();
    return target.native().starts_with(std::string(kOwnDatabase) + "/") && !fs::exists(target, error);
}

void UnlinkGone(const fs::path& database) {
    for (const std::string& szBrand : Directories(database)) {
        for (const std::string& szModel : Directories(database / szBrand)) {
            const fs::path model = database / szBrand / szModel;
            const auto rgszNames = tavo::NamesIn(model);
            for (const std::string& szName : rgszNames.value()) {
                if (IsGone(model / szName)) {
                    unlink((model / szName).c_str());
                }
            }
        }
    }
}

}  // namespace

namespace tavo {

std::vector<std::string> Directories(const fs::path& dir) {
    std::vector<std::string> rgszNames = NamesIn(dir).value();
    std::erase_if(rgszNames, [&dir](const std::string& szName) { return !IsDirectory(dir / szName); });
    std::sort(rgszNames.begin(), rgszNames.end());
    return rgszNames;
}

void BringBackDatabase() {
    if (Rename(kDatabaseAside, kDatabase, RENAME_NOREPLACE)) {
        SysLog(LOG_WARNING, "%s was missing; the one before is back in its place", kDatabase);
    }
}

void LinkOwnDescriptions(const fs::path& database) {
    if (IsDirectory(database)) {
        UnlinkGone(database);
    }
    if (!IsDirectory(kOwnDatabase)) {
        return;
    }
    for (const std::string& szBrand : Directories(kOwnDatabase)) {
        for (const std::string& szModel : Directories(fs::path(kOwnDatabase) / szBrand)) {
            const fs::path own = fs::path(kOwnDatabase) / szBrand / szModel;
            for (const std::string& szName : Directories(own)) {
                Link(own / szName, database / szBrand / szModel / szName);
            }
            if (IsFile(own / kGeneric)) {
                Link(own / kGeneric, database / szBrand / szModel / kGeneric);
            }
        }
    }
}

}  // namespace tavo

int RouterDBList(TLIBCSzList** ppList) {
    return AtBorder(-1, [&] {
        if (ppList == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        tavo::BringBackDatabase();
        tavo::LinkOwnDescriptions(kDatabase);
        if (!IsDirectory(kDatabase) && !IsDirectory(kOwnDatabase)) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        std::vector<std::string> rgszNames;
        for (const char* szPlace : {kDatabase, kOwnDatabase}) {
            for (const std::string& szBrand :
                 IsDirectory(szPlace) ? Directories(szPlace) : std::vector<std::string>()) {
                for (const std::string& szModel : Directories(fs::path(szPlace) / szBrand)) {
                    AddNames(szBrand, szModel, rgszNames);
                }
            }
        }
        std::sort(rgszNames.begin(), rgszNames.end());
        rgszNames.erase(std::unique(rgszNames.begin(), rgszNames.end()), rgszNames.end());
        std::unique_ptr<TLIBCSzList, decltype(&TLIBCSzListFree)> pList(TLIBCSzListAlloc(0), &TLIBCSzListFree);
        for (const std::string& szName : rgszNames) {
            if (TLIBCSzListPush(pList.get(), szName.c_str()) < 0) {
                throw std::bad_alloc();
            }
        }
        *ppList = pList.release();
        return TLIBCSzListCount(*ppList);
    });
}

int TAVOPFRouterDBLoadDescAndOpsByIp(const TAVO_PF_CONF* pSection, TAVO_PF_CONF** ppDesc, TAVO_ROUTER_SCRIPT** ppOps) {
    return AtBorder(-1, [&] {
        if (pSection == nullptr || pSection->pHash == nullptr || ppDesc == nullptr || ppOps == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        tavo::BringBackDatabase();
        const fs::path dir = DescriptionDir(pSection);
        if (dir.empty()) {
            return Fail(TLIBC_ERR_NOT_FOUND);
        }
        tavo::ConfList pDesc = tavo::LoadConfList((dir / "router.des").c_str());
        auto pOps = std::make_unique<TAVO_ROUTER_SCRIPT>();
        if (IsFile(dir / "router.ops")) {
            pOps->pOperations = tavo::LoadConfList((dir / "router.ops").c_str());
        }
        if (!pDesc) {
            return Fail(TLIBC_ERR_FORMAT);
        }
        *ppDesc = pDesc.release();
        *ppOps = pOps.release();
        return 0;
    });
}

void TAVORouterScriptFree(TAVO_ROUTER_SCRIPT* pOps) {
    delete pOps;
}
