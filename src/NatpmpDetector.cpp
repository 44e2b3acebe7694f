// Whether the gateway is a base station to be driven through NAT-PMP, told by its announcement on the
// network. Relies on the avahi service, the file of announced base stations, task records and the
// compatibility database. Promises: one detection at a time; a stale announcement never counts; the wait
// is bounded; a record that was begun is published on every path.
#include <unistd.h>

#include "Border.h"
#include "DaemonStart.h"
#include "Lock.h"
#include "Log.h"
#include "Sections.h"
#include "TaskRecord.h"
#include "tavo/task.h"

namespace {

constexpr char kFile[] = "src/NatpmpDetector.cpp";
constexpr char kTask[] = ".natpmp_detector";
constexpr char kLock[] = "/tmp/natpmp_detector.lock";
constexpr char kAnnounced[] = "/tmp/airport.tcp.local";
constexpr char kService[] = "avahi";
constexpr char kAirPort[] = "AirPort";
constexpr int kAirportPolls = 6;
constexpr unsigned kPollSeconds = 1;

constexpr char kSupport[] = "support_natpmp";
constexpr char kUserSettingName[] = "natpmp_user_setting_name";
constexpr char kBrand[] = "natpmp_brand";
constexpr char kModel[] = "natpmp_model";
constexpr char kVersion[] = "natpmp_version";

using tavo::lib::AtBorder;
using tavo::lib::LogError;
using tavo::lib::Refuse;
using tavo::lib::TaskUpdate;

// The list must be seen in two polls in a row, so that it is whole, unless it comes with the last one.
bool WaitForAnnouncements() {
    bool blSeen = false;
    for (int nPoll = 0; nPoll < kAirportPolls; ++nPoll) {
        const bool blExist = TLIBCFileExist(kAnnounced) == 1;
        if (blSeen && blExist) {
            return true;
        }
        blSeen = blExist;
        sleep(kPollSeconds);
    }
    return blSeen;
}

// The gateway is something else.
bool IsNoBaseStation(TaskUpdate& record) {
    tavo::lib::SetRunKey(tavo::lib::kNatpmpRunKey, "no");
    record.Set(kSupport, "no");
    return true;
}

// Everything between the beginning and the end of the record's update.
bool Detect(TaskUpdate& record, tavo::lib::Hash& pHash, const char* szGatewayIP) {
    unlink(kAnnounced);
    if (TLIBServiceRestart(kService) < 0) {
        return Refuse("%s:%d call TLIBNetService() error", kFile, __LINE__);
    }
    if (!WaitForAnnouncements()) {
        return IsNoBaseStation(record);
    }
    pHash.reset(TLIBCSzHashAlloc(tavo::lib::kHashSize));
    if (!pHash) {
        return Refuse("%s:%d Failed to alloc hash", kFile, __LINE__);
    }
    if (TLIBCFileGetSection(kAnnounced, szGatewayIP, pHash.get()) < 1) {
        LogError("%s:%d Failed to Get Section [%s], so that target router is not natpmp", kFile, __LINE__, szGatewayIP);
        return IsNoBaseStation(record);
    }
    const char* szName = TLIBCSzHashGetValue(pHash.get(), "name");
    record.Set(kUserSettingName, szName == nullptr ? "" : szName);
    record.Set(kBrand, kAirPort);
    record.Set(kModel, "");
    record.Set(kVersion, "");

    std::string szSupport;
    if (!RouterUpnpDB(kAirPort, "", "").GetSupport(szSupport)) {
        LogError("%s:%d Failed to query router upnp db", kFile, __LINE__);
        record.Set(kSupport, "no");
        return false;
    }
    record.Set(kSupport, szSupport.c_str());
    return true;
}

}  // namespace

NatpmpDetector::NatpmpDetector() = default;

NatpmpDetector::~NatpmpDetector() = default;

bool NatpmpDetector::Start(const char* szGatewayIP) {
    return AtBorder(false, [&] {
        if (szGatewayIP == nullptr || *szGatewayIP == '\0') {
            return Refuse("%s:%d szGatewayIP is NULL or empty", kFile, __LINE__);
        }
        tavo::lib::FileLock lock(kLock);
        if (!lock.Get()) {
            return Refuse("%s:%d another natpmp detector is running", kFile, __LINE__);
        }
        tavo::lib::Hash pHash;
        NOS::TaskMgr manager(tavo::lib::kTaskOwner);
        std::unique_ptr<NOS::Task> pTask(manager.getTask(kTask));
        if (!pTask) {
            pTask.reset(manager.createTask(kTask));
        }
        if (!pTask) {
            return Refuse("%s:%d memory is not enough", kFile, __LINE__);
        }
        TaskUpdate record(*pTask);
        const bool blDetected = Detect(record, pHash, szGatewayIP);
        return record.End() && blDetected;
    });
}

std::string NatpmpDetector::GetStr(const std::string& key) {
    return tavo::lib::TaskText(kTask, key.c_str());
}

std::string NatpmpDetector::GetVersion() {
    return GetStr(kVersion);
}

std::string NatpmpDetector::GetBrand() {
    return GetStr(kBrand);
}

std::string NatpmpDetector::GetUserSettingName() {
    return GetStr(kUserSettingName);
}

std::string NatpmpDetector::GetModel() {
    return GetStr(kModel);
}

std::string NatpmpDetector::GetSupportNatpmp() {
    return GetStr(kSupport);
}
