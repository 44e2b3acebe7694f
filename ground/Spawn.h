// How a program of its own is started beside us. Relies on posix_spawn. Promises: it begins with every signal at its
// default and none blocked, and with no descriptor above standard error; rather none than one that could hold ours.
#pragma once

#include <signal.h>
#include <spawn.h>
#include <unistd.h>

namespace tavo {

class SpawnSetup {
public:
    // fdInput: what becomes its standard input; -1: ours. blOwnSession: it is not ended with us.
    explicit SpawnSetup(int fdInput = -1, bool blOwnSession = false) {
        posix_spawn_file_actions_init(&mActions);
        mNErr = fdInput >= 0 ? posix_spawn_file_actions_adddup2(&mActions, fdInput, STDIN_FILENO) : 0;
        mNErr = mNErr != 0 ? mNErr : posix_spawn_file_actions_addclosefrom_np(&mActions, STDERR_FILENO + 1);
        posix_spawnattr_init(&mAttributes);
        sigset_t all;
        sigset_t none;
        sigfillset(&all);
        sigemptyset(&none);
        posix_spawnattr_setsigdefault(&mAttributes, &all);
        posix_spawnattr_setsigmask(&mAttributes, &none);
        const int nFlags =
            POSIX_SPAWN_SETSIGDEF | POSIX_SPAWN_SETSIGMASK | (blOwnSession ? int{POSIX_SPAWN_SETSID} : 0);
        posix_spawnattr_setflags(&mAttributes, static_cast<short>(nFlags));
    }
    ~SpawnSetup() {
        posix_spawn_file_actions_destroy(&mActions);
        posix_spawnattr_destroy(&mAttributes);
    }
    SpawnSetup(const SpawnSetup&) = delete;
    SpawnSetup& operator=(const SpawnSetup&) = delete;

    // 0: pid is the child's; else the system's word for why there is none, and pid is untouched.
    int Spawn(pid_t& pid, const char* szPath, char* const* rgszArguments, char* const* rgszEnvironment) const {
        return mNErr != 0 ? mNErr : posix_spawn(&pid, szPath, &mActions, &mAttributes, rgszArguments, rgszEnvironment);
    }

private:
    posix_spawn_file_actions_t mActions;
    posix_spawnattr_t mAttributes;
    int mNErr;
};

}  // namespace tavo
