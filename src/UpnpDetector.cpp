// Whether the gateway speaks UPnP, what it is, and whether its model is known to work. Relies on the
// platform's UPnP client and task records and on the compatibility database. Promises: one detection at a
// time; a record that was begun is published on every path, and describes the last run only.
#include <memory>

#include "Border.h"
#include "DaemonStart.h"
#include "Lock.h"
#include "Log.h"
#include "TaskRecord.h"
#include "Text.h"
#include "tavo/core.h"
#include "tavo/task.h"
#include "tavo/upnp.h"

namespace {

constexpr char kFile[] = "src/UpnpDetector.cpp";
constexpr char kTask[] = ".upnp_detector";
constexpr char kLock[] = "/tmp/upnp_detector.lock";
constexpr int kSearchLimitSeconds = 30;
constexpr int kLocalPort = 55002;

constexpr char kSupport[] = "support_upnp";
constexpr char kModel[] = "router_model";
constexpr char kBrand[] = "router_brand";
constexpr char kVersion[] = "router_version";
constexpr char kAble[] = "able_get_brand_model_version";
constexpr char kPfPath[] = "upnp_pfpath";

using tavo::lib::AtBorder;
using tavo::lib::LogError;
using tavo::lib::Refuse;
using tavo::lib::TaskUpdate;

bool HasDescription(const std::string& szBrand, const std::string& szModel, const std::string& szVersion) {
    if (!tavo::lib::IsPathPart(szBrand) || !tavo::lib::IsPathPart(szModel) || !tavo::lib::IsPathPart(szVersion)) {
        return false;
    }
    const std::string szPath =
        std::string(tavo::lib::kRouterDbDir) + "/" + szBrand + "/" + szModel + "/" + szVersion + "/router.des";
    return TLIBCFileExist(szPath.c_str()) == 1;
}

// Publishes the name of the model's description, when that description is here or can be fetched.
void NotePfPath(TaskUpdate& record, std::string szPfPath) {
    std::string szBrand;
    std::string szModel;
    std::string szVersion;
    if (!SplitRouterName(szPfPath.data(), szBrand, szModel, szVersion)) {
        LogError("%s:%d split router name failed", kFile, __LINE__);
    }
    if (!HasDescription(szBrand, szModel, szVersion)) {
        int nVersion = 0;
        if (!RouterDB::Update(nVersion)) {
            LogError("%s:%d update router db failed", kFile, __LINE__);
        }
        if (!HasDescription(szBrand, szModel, szVersion)) {
            LogError("%s:%d pfPath does not exist", kFile, __LINE__);
            return;
        }
    }
    record.Set(kPfPath, szPfPath.c_str());
}

// Everything between the beginning and the end of the record's update.
bool Detect(TaskUpdate& record) {
    TAVOUpnpCleanup();
    if (TAVOUpnpInit(kSearchLimitSeconds, kLocalPort) == 1) {
        tavo::lib::SetRunKey(tavo::lib::kUpnpRunKey, "no");
        LogError("%s:%d init UPnP faild", kFile, __LINE__);
        record.Set(kSupport, "no");
        return true;
    }
    TAVO_UPNP_GATEWAY_MODEL model = {};
    if (TAVOUpnpGatewayModelGet(&model) != 0) {
        record.Set(kSupport, "no");
        return true;
    }
    record.Set(kModel, model.szModel);
    record.Set(kBrand, model.szBrand);
    record.Set(kVersion, model.szVersion);
    record.Set(kAble, "yes");

    RouterUpnpDB db(model.szBrand, model.szModel, model.szVersion);
    std::string szPfPath;
    if (db.GetPfpath(szPfPath) && !szPfPath.empty()) {
        NotePfPath(record, szPfPath);
    }
    std::string szSupport;
    if (!db.GetSupport(szSupport)) {
        LogError("%s:%d query router upnp db failed", kFile, __LINE__);
        record.Set(kSupport, "no");
        return false;
    }
    record.Set(kSupport, szSupport.c_str());
    return true;
}

}  // namespace

UpnpDetector::UpnpDetector() = default;

UpnpDetector::~UpnpDetector() = default;

bool UpnpDetector::Start() {
    return AtBorder(false, [] {
        NOS::TaskMgr manager(tavo::lib::kTaskOwner);
        std::unique_ptr<NOS::Task> pTask(manager.getTask(kTask));
        tavo::lib::FileLock lock(kLock);
        if (!lock.Get()) {
            return Refuse("%s:%d another upnp detector is running", kFile, __LINE__);
        }
        if (!pTask) {
            pTask.reset(manager.createTask(kTask));
        }
        if (!pTask) {
            return false;
        }
        TaskUpdate record(*pTask);
        const bool blDetected = Detect(record);
        lock.Release();
        return record.End() && blDetected;
    });
}

std::string UpnpDetector::GetStr(const std::string& key) {
    return tavo::lib::TaskText(kTask, key.c_str());
}

std::string UpnpDetector::GetPfPath() {
    return GetStr(kPfPath);
}

std::string UpnpDetector::GetVersion() {
    return GetStr(kVersion);
}

std::string UpnpDetector::GetBrand() {
    return GetStr(kBrand);
}

std::string UpnpDetector::GetModel() {
    return GetStr(kModel);
}

std::string UpnpDetector::GetSupportUpnp() {
    return GetStr(kSupport);
}

bool UpnpDetector::IsAbleToGetBrandModelVersion() {
    return GetStr(kAble) == "yes";
}
