// A settings file is replaced so that one of the two is always there, also after a crash. Relies on the platform's
// reading back of what a killed writer set aside.
#pragma once

#include <sys/stat.h>

#include <functional>
#include <string>

namespace tavo::lib {

// Owner and mode of the file at szPath. One that is made afresh in its place takes them: whoever may read the old one
// may read it too.
class OwnerAndMode {
public:
    explicit OwnerAndMode(const char* szPath);
    void GiveTo(const char* szPath) const;
    // For a file that gets a password, and may not have had one: one that anybody could read is its owner's alone then.
    void HideFromOthers();

private:
    struct stat mStatus = {};
    bool mBlKnown;
};

// What was renamed and deleted in the directory of the file at szPath is so after a power cut, too.
void FlushDirectoryOf(const char* szPath);

// Holds the file at szPath, under whatever name it gets meanwhile, as long as the object and the process live: readers
// bring back what a killed writer set aside, and leave alone what is held. By a read lock, so that nobody who may only
// read the file can be in its way.
class HeldFile {
public:
    explicit HeldFile(const char* szPath);
    ~HeldFile() { Release(); }
    HeldFile(const HeldFile&) = delete;
    HeldFile& operator=(const HeldFile&) = delete;

    // False: a reader could take it for what a killed writer left. Where there is no file, there is nothing to hold.
    bool IsHeld() const { return mBlHeld; }

private:
    void Release();

    int mFd = -1;
    bool mBlHeld = false;
};

// A name beside szPath that nothing has yet: szPath and six letters and digits as nobody chooses them. The platform
// brings back what a killed writer left under such a name: for one that writes the file anew where it is missing, for a
// report (whose name has a digit first) whatever is there.
enum class AsideFor { kWriting, kReport };
std::string UniqueName(const char* szPath, AsideFor enFor);

// Whether a file has a secret in it, which anybody could read and is its owner's alone from then on.
enum class Holds { kNoSecret, kSecret };

// Replaces szPath safely: the live file is renamed to a unique name beside it, fnWrite writes the new
// one, and the old one is deleted after success (the new one takes its owner and mode) and renamed back
// after failure. True when fnWrite succeeded; every failure is logged, and what fnWrite throws is one.
bool ReplaceFile(const char* szPath, Holds enHolds, const std::function<bool()>& fnWrite);

}  // namespace tavo::lib
