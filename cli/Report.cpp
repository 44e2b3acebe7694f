// "report": the files of a compatibility test to the report server. Relies on
// TLibUploadTestUpnpCompatibilityFailResult. Promises: a failure names what was missing, as far as that can be
// seen, and where the archive is that was made.
#include <fmt/format.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <charconv>
#include <ctime>
#include <filesystem>
#include <iterator>

#include "Box.h"
#include "Commands.h"
#include "Usage.h"
#include "Verdict.h"
#include "tavo/upnptest.h"

namespace tavo::cli {

namespace {

constexpr const char* kTestFiles[] = {"/tmp/upnp_test.progress", "/var/tmp/upnp_portmap.status", "/var/log/router.log",
                                      "/tmp/pfStatusRule"};
constexpr std::string_view kArchiveEnd = ".tgz";

// A file that this user has written since nBegin, under no other name. Anybody may put something into /tmp whose name
// looks like the archive's.
bool IsOwnSince(const std::filesystem::path& path, std::time_t nBegin) {
    struct stat status = {};
    return lstat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode) && status.st_uid == geteuid() &&
           status.st_nlink == 1 && status.st_mtime >= nBegin;
}

// "/tmp/BRAND_SECONDS.tgz" of a time since nBegin; empty when there is none.
std::string ArchiveSince(std::time_t nBegin) {
    std::error_code error;
    for (const auto& entry : std::filesystem::directory_iterator("/tmp", error)) {
        const std::string szName = entry.path().filename().string();
        if (!szName.ends_with(kArchiveEnd)) {
            continue;
        }
        const size_t nSeconds = szName.rfind('_') + 1;
        std::time_t nMade = 0;
        const char* pEnd = szName.data() + szName.size() - kArchiveEnd.size();
        const auto [pRead, fault] = std::from_chars(szName.data() + nSeconds, pEnd, nMade);
        if (fault == std::errc() && pRead == pEnd && nMade >= nBegin && nMade <= std::time(nullptr) &&
            IsOwnSince(entry.path(), nBegin)) {
            return entry.path().string();
        }
    }
    return "";
}

std::string MissingFiles() {
    std::vector<std::string> rgszMissing;
    std::copy_if(std::begin(kTestFiles), std::end(kTestFiles), std::back_inserter(rgszMissing),
                 [](const char* szFile) { return !std::filesystem::exists(szFile); });
    return Join(rgszMissing);
}

// Why there is no archive at all.
std::string WhyNotMade() {
    DetectResult detected = {};
    TLibGetRouterDetectResult(&detected);
    if (*detected.szBrand == '\0' && *detected.szModel == '\0') {
        return "a report says which router it is about, and none has been found yet: 'sudo tavoportmap detect' looks "
               "for it";
    }
    if (!CanBeReported()) {
        return fmt::format(
            "a report is about a router that a database or a test knows to work with UPnP or NAT-PMP, which this one "
            "is not by the last detection ('sudo tavoportmap detect' makes another). The files of its last test are {}",
            fmt::join(kTestFiles, ", "));
    }
    return "its files could not be packed; the system log says why";
}

// Why an archive that was made was not sent.
std::string WhyNotSent(const std::string& szMissing, const std::string& szArchive) {
    const bool blServer = *GetUPnPReportServer() != '\0';
    const std::string szCause =
        !szMissing.empty()
            ? fmt::format("the last test did not leave {}; 'sudo tavoportmap compat' runs one", szMissing)
        : blServer ? "the server, which is named in [report] of /etc/tavo/platform.conf, did not take it"
                   : "no server is named to send it to (server in [report] of /etc/tavo/platform.conf)";
    return fmt::format("{}. What there is stays in {}", szCause, Clean(szArchive));
}

bool IsLocked() {
    const Lock lock;
    return !lock.IsHeld();
}

Reply Report() {
    if (const auto reply = NeedsRoot()) {
        return *reply;
    }
    if (!Gateway()) {
        return NoGateway();
    }
    const std::string szMissing = MissingFiles();
    const std::time_t nBegin = std::time(nullptr);
    const bool blSent = TLibUploadTestUpnpCompatibilityFailResult() == 0;
    const std::string szArchive = ArchiveSince(nBegin);
    Reply reply;
    if (blSent) {
        reply.szMessage = "the report is sent";
        reply.szMessage += szArchive.empty() ? "" : fmt::format("; a copy stays in {}", Clean(szArchive));
    } else if (szArchive.empty() && IsLocked()) {
        reply = Busy();
    } else {
        reply = Failure("no report was sent: " + (szArchive.empty() ? WhyNotMade() : WhyNotSent(szMissing, szArchive)));
    }
    reply.jsAnswer["archive"] = szArchive.empty() ? Json::Value() : Json::Value(szArchive);
    return reply;
}

}  // namespace

void OfferReport(CLI::App& app, Request& request) {
    CLI::App* pReport = AddCommand(app, "report", "send the files of a failed compatibility test");
    pReport->footer(
        "Packs what the last 'compat' left, with the brand, model and version of the router, and sends it to the "
        "report server (server in [report] of /etc/tavo/platform.conf). Your settings and passwords are not in it. It "
        "can be made of a router that a database or a test knows to work with UPnP or NAT-PMP; of another one the "
        "files are named.\n");
    pReport->callback([&request] { request.fnCommand = &Report; });
}

}  // namespace tavo::cli
