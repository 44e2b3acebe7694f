// Runs a program and reads its output. Relies on posix_spawn and poll. Promises: see Child.h.
#include "Child.h"

#include <fcntl.h>
#include <poll.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>

namespace tavo::cli {

namespace {

using Clock = std::chrono::steady_clock;

pid_t Spawn(const std::vector<std::string>& rgszArguments, int fdOutput, bool blOwnSession) {
    std::vector<char*> rgpArguments;
    rgpArguments.reserve(rgszArguments.size() + 1);
    for (const std::string& szArgument : rgszArguments) {
        rgpArguments.push_back(const_cast<char*>(szArgument.c_str()));
    }
    rgpArguments.push_back(nullptr);
    char* rgpEnvironment[] = {nullptr};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDIN_FILENO, "/dev/null", O_RDONLY, 0);
    posix_spawn_file_actions_adddup2(&actions, fdOutput, STDOUT_FILENO);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    posix_spawn_file_actions_addclosefrom_np(&actions, STDERR_FILENO + 1);  // the router lock above all
    posix_spawnattr_t attributes;
    posix_spawnattr_init(&attributes);
    posix_spawnattr_setflags(&attributes, static_cast<short>(blOwnSession ? int{POSIX_SPAWN_SETSID} : 0));
    pid_t nPid = -1;
    const int nError = posix_spawn(&nPid, rgpArguments[0], &actions, &attributes, rgpArguments.data(), rgpEnvironment);
    posix_spawnattr_destroy(&attributes);
    posix_spawn_file_actions_destroy(&actions);
    return nError == 0 ? nPid : -1;
}

// Reads to the end; false when it does not come in time or the text is too long.
bool ReadAll(int fd, Clock::time_point end, size_t nMost, std::string& szText) {
    char rgChunk[4096];
    while (szText.size() <= nMost) {
        const auto nLeft = std::chrono::duration_cast<std::chrono::milliseconds>(end - Clock::now()).count();
        pollfd waiting = {fd, POLLIN, 0};
        if (nLeft <= 0 || poll(&waiting, 1, static_cast<int>(nLeft)) == 0) {
            return false;
        }
        const ssize_t nRead = TEMP_FAILURE_RETRY(read(fd, rgChunk, sizeof(rgChunk)));
        if (nRead <= 0) {
            return nRead == 0;
        }
        szText.append(rgChunk, static_cast<size_t>(nRead));
    }
    return false;
}

}  // namespace

std::string OutputOf(const std::vector<std::string>& rgszArguments, std::chrono::milliseconds limit, size_t nMost,
                     bool blOwnSession) {
    int rgFds[2] = {-1, -1};
    if (pipe2(rgFds, O_CLOEXEC) != 0) {
        return "";
    }
    const pid_t nPid = Spawn(rgszArguments, rgFds[1], blOwnSession);
    close(rgFds[1]);
    std::string szText;
    const bool blWhole = nPid > 0 && ReadAll(rgFds[0], Clock::now() + limit, nMost, szText);
    close(rgFds[0]);
    if (nPid <= 0) {
        return "";
    }
    if (!blWhole) {
        kill(nPid, SIGKILL);
    }
    int nStatus = -1;
    TEMP_FAILURE_RETRY(waitpid(nPid, &nStatus, 0));
    return blWhole && WIFEXITED(nStatus) && WEXITSTATUS(nStatus) == 0 ? szText : "";
}

}  // namespace tavo::cli
