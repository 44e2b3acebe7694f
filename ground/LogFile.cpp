// Appends lines to the platform's logs. Relies on O_APPEND. Promises: see LogFile.h.
#include "ground/LogFile.h"

#include <fcntl.h>
#include <unistd.h>

#include <ctime>

#include "ground/Descriptor.h"

namespace tavo {

namespace {

constexpr mode_t kLogMode = 0640;

}  // namespace

std::string LogTime() {
    const std::time_t nNow = std::time(nullptr);
    std::tm parts = {};
    char szTime[32] = {};
    localtime_r(&nNow, &parts);
    std::strftime(szTime, sizeof(szTime), "%Y-%m-%dT%H:%M:%S%z", &parts);
    return szTime;
}

bool AppendLogLine(const char* szPath, std::string szLine) {
    szLine += "\n";
    const Descriptor fd(open(szPath, O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC | O_NOFOLLOW, kLogMode));
    return fd.Get() >= 0 && write(fd.Get(), szLine.data(), szLine.size()) == static_cast<ssize_t>(szLine.size());
}

}  // namespace tavo
