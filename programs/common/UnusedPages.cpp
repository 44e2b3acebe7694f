// Starts a program beside us. Relies on posix_spawn and the kernel's descriptors of processes. Promises: see
// UnusedPages.h.
#include "programs/common/UnusedPages.h"

#include <json/json.h>
#include <sys/syscall.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>

#include "ground/Spawn.h"
#include "ground/SysLog.h"
#include "ground/TextFile.h"
#include "programs/common/MadeFile.h"

namespace tavo {

namespace {

// By this name nobody takes it for a save under way.
constexpr char kProgram[] = "/usr/tavo/bin/tavopages";
constexpr char kPublished[] = "/run/tavo/tavoportforward.json";
constexpr auto kPause = std::chrono::minutes(5);  // routers lock out who comes again and again with a wrong password

// Whether the pages were asked lately, by us or by the tool before its save, and could not.
bool IsJustTried() {
    const std::string szText = ReadFile(kPublished).value_or("");
    const std::unique_ptr<Json::CharReader> pReader(Json::CharReaderBuilder().newCharReader());
    Json::Value js;
    if (!pReader->parse(szText.data(), szText.data() + szText.size(), &js, nullptr) || !js.isObject()) {
        return false;
    }
    const bool blInUse = !js["switched_on"].isBool() || js["switched_on"].asBool();
    const Json::Int64 nAt = js["at"].isInt64() ? js["at"].asInt64() : 0;
    return !blInUse && std::abs(std::time(nullptr) - nAt) < std::chrono::seconds(kPause).count();
}

bool HasMade(const RouterName& router) {
    Record record = MadeFile(kPagesMadeFile).Get();
    record.TurnTo(router);
    return !record.Here().empty() || TLIBCFileExist(kEarlierPagesFile) == 1;
}

}  // namespace

void UnusedPages::Clear(const RouterName& router) {
    TakeEnd();
    if (mPid > 0 || BootClock::now() < mNext || !HasMade(router) || IsJustTried()) {
        return;
    }
    mNext = BootClock::now() + kPause;
    char szName[] = "tavopages";
    char szMode[] = "--clear-unused";
    char* const rgszArguments[] = {szName, szMode, nullptr};
    char* const rgszEnvironment[] = {nullptr};
    if (const int nErrno = SpawnSetup(-1, true).Spawn(mPid, kProgram, rgszArguments, rgszEnvironment); nErrno != 0) {
        mPid = -1;
        SysLog(LOG_ERR, "cannot run %s: %s; the router's own pages go on forwarding what they have", kProgram,
               std::strerror(nErrno));
        return;
    }
    mFdEnd.Reset(static_cast<int>(syscall(SYS_pidfd_open, mPid, 0)));
    SysLog(LOG_NOTICE,
           "the router's own pages, which are not in use any more, are asked to take away what they forward");
}

bool UnusedPages::TakeEnd() {
    if (mPid <= 0 || waitpid(mPid, nullptr, WNOHANG) != mPid) {
        return false;
    }
    mPid = -1;
    mFdEnd.Reset();
    return true;
}

}  // namespace tavo
