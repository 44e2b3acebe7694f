// The recorder behind disk.h: stand-ins for the C library's calls that change files.
#include "disk.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/mount.h>
#include <unistd.h>

#include <cerrno>
#include <cstdarg>
#include <cstdio>
#include <filesystem>
#include <optional>
#include <set>

#include "world.h"

namespace fs = std::filesystem;

bool gBlDirectoriesFail = false;
int gNRenamesLeft = -1;
bool gBlKilled = true;
bool gBlExchanges = true;
std::string gSzForeign;

namespace {

constexpr int kMostStates = 20000;  // of one writer: more, and the model or the writer has gone astray

thread_local bool gBlOwn = false;  // the recorder's own doing
Disk* gPRecording = nullptr;
std::map<uint64_t, ino_t> gMapInodes;  // of a state that was built: the numbers that the files had when written

class Own {
public:
    Own() : mBlBefore(std::exchange(gBlOwn, true)) {}
    ~Own() { gBlOwn = mBlBefore; }
    Own(const Own&) = delete;
    Own& operator=(const Own&) = delete;

private:
    const OwnMemory mMemory;
    bool mBlBefore;
};

uint64_t IdOf(const struct stat& status) {
    return (uint64_t{status.st_dev} << 40U) + status.st_ino;
}

uint64_t IdOf(const std::string& szPath) {
    struct stat status = {};
    return lstat(szPath.c_str(), &status) == 0 ? IdOf(status) : 0;
}

std::string PathOf(int fd) {
    return "/proc/self/fd/" + std::to_string(fd);
}

std::string DirOf(const std::string& szPath) {
    const std::string szParent = fs::path(szPath).parent_path();
    return szParent.empty() ? "." : szParent;
}

void Pretend(struct stat* pStatus) {
    if (!gBlOwn && !gMapInodes.empty()) {
        const auto it = gMapInodes.find(IdOf(*pStatus));
        pStatus->st_ino = it == gMapInodes.end() ? pStatus->st_ino : it->second;
    }
}

}  // namespace

// What the stand-ins tell of.
struct Recorder {
    using Id = Disk::Id;

    static bool IsOn() { return gPRecording != nullptr && !gBlOwn; }
    static bool IsThere(Id nId) { return nId != 0 && gPRecording->mInodes.contains(nId); }

    static Disk::Inode Look(const std::string& szPath, const struct stat& status) {
        Disk::Inode inode{status.st_mode, status.st_uid, status.st_gid, status.st_mtim, {}};
        inode.szData = S_ISREG(status.st_mode)   ? Read(szPath)
                       : S_ISLNK(status.st_mode) ? fs::read_symlink(szPath).string()
                                                 : "";
        return inode;
    }
    static void Tell(Disk::Event event) { gPRecording->mRgEvents.push_back(std::move(event)); }

    // A name, and what stands under it now.
    static std::optional<std::pair<Disk::Name, Id>> NameNow(const std::string& szPath) {
        struct stat dir = {};
        if (stat(DirOf(szPath).c_str(), &dir) != 0 || !IsThere(IdOf(dir))) {
            return std::nullopt;
        }
        return std::pair{Disk::Name{IdOf(dir), fs::path(szPath).filename()}, IdOf(szPath)};
    }
    static void Names(const std::string& szText, const std::vector<std::string>& rgszPaths) {
        Disk::Event event;
        event.szText = szText;
        for (const std::string& szPath : rgszPaths) {
            event.szText += " " + szPath;
            if (auto name = NameNow(szPath)) {
                event.rgNames.push_back(*name);
            }
        }
        if (!event.rgNames.empty()) {
            Tell(std::move(event));
        }
    }
    // Something new; it has nothing on the disk yet.
    static void Made(const std::string& szPath) {
        const auto name = NameNow(szPath);
        struct stat status = {};
        if (!name || lstat(szPath.c_str(), &status) != 0 || IsThere(IdOf(status))) {
            return;
        }
        Disk::Inode inode = Look(szPath, status);
        if (S_ISREG(status.st_mode)) {
            inode.szData.clear();
        }
        gPRecording->mInodes[IdOf(status)] = inode;
        Names("make", {szPath});
    }
    static void Changed(const std::string& szPath, const char* szWhat) {
        struct stat status = {};
        if (stat(szPath.c_str(), &status) == 0 && IsThere(IdOf(status))) {
            Disk::Event event;
            event.nInode = IdOf(status);
            event.inode = Look(szPath, status);
            event.szText = szWhat;
            Tell(std::move(event));
        }
    }
    static void Marked() {
        Disk::Event event;
        event.blMark = true;
        event.szText = "MARK";
        Tell(std::move(event));
    }
    static void Flushed(int fd, bool blAll) {
        struct stat status = {};
        if (blAll || (fstat(fd, &status) == 0 && IsThere(IdOf(status)))) {
            Disk::Event event;
            event.nInode = blAll ? 0 : IdOf(status);
            event.blFlush = true;
            event.szText = blAll ? "flush all" : S_ISDIR(status.st_mode) ? "flush directory" : "flush";
            Tell(std::move(event));
        }
    }
};

void Mark() {
    if (Recorder::IsOn()) {
        const Own own;
        Recorder::Marked();
    }
}

// ---- the disk ------------------------------------------------------------------------------------------------

Disk::Disk(std::vector<std::string> rgszPlaces) : mRgszPlaces(std::move(rgszPlaces)) {
    for (const std::string& szPlace : mRgszPlaces) {
        fs::create_directories(szPlace);
        EXPECT_EQ(mount("tmpfs", szPlace.c_str(), "tmpfs", 0, "mode=0755"), 0) << szPlace;
    }
}

Disk::~Disk() {
    for (size_t i = 0; mBlMounted && i < mRgszPlaces.size(); ++i) {
        umount2(mRgszPlaces[i].c_str(), MNT_DETACH);
    }
}

Disk::Id Disk::Root(size_t i) const {
    return IdOf(mRgszPlaces[i]);
}

void Disk::Take(const std::string& szDir) {
    struct stat status = {};
    EXPECT_EQ(lstat(szDir.c_str(), &status), 0) << szDir;
    mInodes[IdOf(status)] = Recorder::Look(szDir, status);
    for (const auto& entry : fs::directory_iterator(szDir)) {
        mNames[{IdOf(status), entry.path().filename()}] = IdOf(entry.path().string());
        if (entry.is_directory() && !entry.is_symlink()) {
            Take(entry.path());
        } else {
            struct stat file = {};
            lstat(entry.path().c_str(), &file);
            mInodes[IdOf(file)] = Recorder::Look(entry.path(), file);
        }
    }
}

void Disk::Record(const std::function<void()>& fnWork) {
    {
        const Own own;
        for (const std::string& szPlace : mRgszPlaces) {
            Take(szPlace);
        }
    }
    gPRecording = this;
    fnWork();
    gPRecording = nullptr;
}

std::string Disk::Text(const Names& names, const Inodes& inodes, Id nDir) {
    std::string szText;
    for (auto it = names.lower_bound({nDir, ""}); it != names.end() && it->first.first == nDir; ++it) {
        const Inode& inode = inodes.at(it->second);
        szText += it->first.second + " " + std::to_string(inode.nMode) + " " + std::to_string(inode.nUser) + " {" +
                  inode.szData + (S_ISDIR(inode.nMode) ? Text(names, inodes, it->second) : "") + "}\n";
    }
    return szText;
}

void Disk::Put(const Names& names, const Inodes& inodes, Id nDir, const std::string& szDir,
               std::map<Id, std::string>& mapMade) {
    for (auto it = names.lower_bound({nDir, ""}); it != names.end() && it->first.first == nDir; ++it) {
        const Inode& inode = inodes.at(it->second);
        const std::string szPath = szDir + "/" + it->first.second;
        if (S_ISDIR(inode.nMode)) {
            mkdir(szPath.c_str(), 0700);
            chmod(szPath.c_str(), inode.nMode & 07777U);
            Put(names, inodes, it->second, szPath, mapMade);
        } else if (S_ISLNK(inode.nMode)) {
            symlink(inode.szData.c_str(), szPath.c_str());
        } else if (const auto made = mapMade.find(it->second); made != mapMade.end()) {
            link(made->second.c_str(), szPath.c_str());
        } else {
            Write(szPath, inode.szData);
            EXPECT_EQ(lchown(szPath.c_str(), inode.nUser, inode.nGroup), 0);
            chmod(szPath.c_str(), inode.nMode & 07777U);
            const timespec rgTimes[] = {inode.changed, inode.changed};
            utimensat(AT_FDCWD, szPath.c_str(), rgTimes, AT_SYMLINK_NOFOLLOW);
            mapMade[it->second] = szPath;
            gMapInodes[IdOf(szPath)] = it->second & ((uint64_t{1} << 40U) - 1);
        }
    }
}

// The states that are possible when the power goes before the event nEnd.
struct Disk::Search {
    Disk& disk;
    const std::function<void(size_t)>& fnLook;
    bool blTwice;
    std::set<std::string> setSeen;
    size_t nEnd = 0;
    size_t nMarks = 0;
    int nStates = 0;
    std::vector<size_t> rgChanges;                 // of names, before nEnd
    std::map<size_t, std::set<size_t>> mapBefore;  // what has to last for a change to last
    std::set<size_t> setLasting;
    std::map<size_t, bool> mapKept;

    bool IsFlushed(Id nInode, size_t nFrom) const {
        for (size_t j = nFrom; j < nEnd; ++j) {
            const Event& event = disk.mRgEvents[j];
            if (event.blFlush && (event.nInode == 0 || event.nInode == nInode)) {
                return true;
            }
        }
        return false;
    }

    void CutBefore(size_t n) {
        nEnd = n;
        nMarks = 0;
        rgChanges.clear();
        setLasting.clear();
        std::map<Name, size_t> mapLast;
        for (size_t i = 0; i < nEnd; ++i) {
            const Event& event = disk.mRgEvents[i];
            nMarks += event.blMark ? 1 : 0;
            if (event.rgNames.empty()) {
                continue;
            }
            rgChanges.push_back(i);
            mapBefore[i].clear();
            for (const auto& [name, nId] : event.rgNames) {
                if (const auto it = mapLast.find(name); it != mapLast.end()) {
                    mapBefore[i].insert(it->second);
                }
                mapLast[name] = i;
            }
            if (IsFlushed(event.rgNames.back().first.first, i)) {
                setLasting.insert(i);
            }
        }
        for (auto it = rgChanges.rbegin(); it != rgChanges.rend(); ++it) {
            if (setLasting.contains(*it)) {
                setLasting.insert(mapBefore[*it].begin(), mapBefore[*it].end());
            }
        }
        mapKept.clear();
        ChooseNames(0);
    }

    void ChooseNames(size_t i) {
        if (nStates > kMostStates) {
            return;
        }
        if (i == rgChanges.size()) {
            Names names = disk.mNames;
            for (const size_t nChange : rgChanges) {
                for (const auto& [name, nId] : disk.mRgEvents[nChange].rgNames) {
                    if (mapKept[nChange] && nId == 0) {
                        names.erase(name);
                    } else if (mapKept[nChange]) {
                        names[name] = nId;
                    }
                }
            }
            std::set<Id> setFiles;
            for (const auto& [name, nId] : names) {
                setFiles.insert(nId);
            }
            ChooseData(names, disk.mInodes, std::vector<Id>(setFiles.begin(), setFiles.end()), 0);
            return;
        }
        const size_t nChange = rgChanges[i];
        bool blMay = true;
        for (const size_t nBefore : mapBefore[nChange]) {
            blMay = blMay && mapKept[nBefore];
        }
        if (blMay) {
            mapKept[nChange] = true;
            ChooseNames(i + 1);
        }
        if (!setLasting.contains(nChange)) {
            mapKept[nChange] = false;
            ChooseNames(i + 1);
        }
    }

    void ChooseData(const Names& names, Inodes inodes, const std::vector<Id>& rgFiles, size_t i) {
        if (i == rgFiles.size()) {
            Show(names, inodes);
            return;
        }
        const Id nId = rgFiles[i];
        Inode now = inodes.at(nId);
        Inode flushed = now;
        for (size_t j = 0; j < nEnd; ++j) {
            const Event& event = disk.mRgEvents[j];
            if (event.blFlush && (event.nInode == 0 || event.nInode == nId)) {
                flushed = now;
            } else if (event.nInode == nId) {
                now = event.inode;
            }
        }
        const std::string& szNew = now.szData;
        std::set<std::string> setData = {flushed.szData, szNew};
        if (setData.size() > 1) {
            setData.insert({szNew.substr(0, szNew.size() / 2), std::string(szNew.size(), '\0')});
        }
        for (const mode_t nMode : std::set<mode_t>{flushed.nMode, now.nMode}) {
            for (const std::string& szData : setData) {
                inodes[nId] = now;
                inodes[nId].nMode = nMode;
                inodes[nId].nUser = nMode == now.nMode ? now.nUser : flushed.nUser;
                inodes[nId].szData = szData;
                ChooseData(names, inodes, rgFiles, i + 1);
            }
        }
    }

    std::string History() const {
        std::string szText;
        for (size_t i = 0; i < nEnd; ++i) {
            const auto it = mapKept.find(i);
            szText += disk.mRgEvents[i].szText + (it != mapKept.end() && !it->second ? "  LOST\n" : "\n");
        }
        return szText;
    }

    void Show(const Names& names, const Inodes& inodes) {
        std::string szText = std::to_string(nMarks);
        for (size_t i = 0; i < disk.mRgszPlaces.size(); ++i) {
            szText += "\n" + Text(names, inodes, disk.Root(i));
        }
        if (!setSeen.insert(szText).second) {
            return;
        }
        ++nStates;
        {
            const Own own;
            gMapInodes.clear();
            std::map<Id, std::string> mapMade;
            for (size_t i = 0; i < disk.mRgszPlaces.size(); ++i) {
                for (const auto& entry : fs::directory_iterator(disk.mRgszPlaces[i])) {
                    fs::remove_all(entry.path());
                }
                disk.Put(names, inodes, disk.Root(i), disk.mRgszPlaces[i], mapMade);
            }
        }
        SCOPED_TRACE(History() + "power cut; left: " + szText);
        if (!blTwice) {
            fnLook(nMarks);
            return;
        }
        Disk again(disk.mRgszPlaces, AsTheyAre{});
        again.Record([&] { fnLook(nMarks); });
        if (!again.mRgEvents.empty()) {
            nStates += again.ForEachCut([&](size_t /*nMarks*/) { fnLook(nMarks); });
        }
    }
};

int Disk::ForEachCut(const std::function<void(size_t nMarks)>& fnLook, bool blTwice) {
    Search search{*this, fnLook, blTwice, {}, 0, 0, 0, {}, {}, {}, {}};
    for (size_t i = 0; i <= mRgEvents.size() && !testing::Test::HasFailure(); ++i) {
        search.CutBefore(i);
    }
    gMapInodes.clear();
    EXPECT_LT(search.nStates, kMostStates);
    return search.nStates;
}

bool Disk::IsWhole() const {
    const Own own;
    Names names = mNames;
    Inodes inodes = mInodes;
    for (const Event& event : mRgEvents) {
        for (const auto& [name, nId] : event.rgNames) {
            names[name] = nId;
        }
        if (!event.blFlush && event.nInode != 0) {
            inodes[event.nInode] = event.inode;
        }
    }
    std::erase_if(names, [](const auto& name) { return name.second == 0; });
    Disk now({}, AsTheyAre{});
    for (const std::string& szPlace : mRgszPlaces) {
        now.Take(szPlace);
        const Id nRoot = IdOf(szPlace);
        EXPECT_EQ(Text(names, inodes, nRoot), Text(now.mNames, now.mInodes, nRoot)) << "unseen changes in " << szPlace;
    }
    return !testing::Test::HasFailure();
}

// ---- the stand-ins -------------------------------------------------------------------------------------------

namespace {

// A call that succeeded is told of by fnTell; errno is the call's.
template <typename Tell>
int Told(int nResult, Tell fnTell) {
    const int nErrno = errno;
    if (nResult >= 0 && Recorder::IsOn()) {
        const Own own;
        fnTell();
    }
    errno = nErrno;
    return nResult;
}

std::string At(int fdDir, const char* szPath) {
    return fdDir == AT_FDCWD || *szPath == '/' ? szPath : PathOf(fdDir) + "/" + szPath;
}

}  // namespace

extern "C" {
int open(const char* szPath, int nFlags, ...) {
    va_list args;
    va_start(args, nFlags);
    const mode_t nMode = (nFlags & (O_CREAT | O_TMPFILE)) != 0 ? va_arg(args, mode_t) : 0;
    va_end(args);
    return Told(Real("open", &open)(szPath, nFlags, nMode), [&] {
        if ((nFlags & O_CREAT) != 0) {
            Recorder::Made(szPath);
        }
        if ((nFlags & O_TRUNC) != 0) {
            Recorder::Changed(szPath, "empty");
        }
    });
}
ssize_t write(int fd, const void* pData, size_t nSize) {
    const ssize_t nWritten = Real("write", &write)(fd, pData, nSize);
    Told(nWritten < 0 ? -1 : 0, [&] { Recorder::Changed(PathOf(fd), "write"); });
    return nWritten;
}
int ftruncate(int fd, off_t nSize) noexcept {
    return Told(Real("ftruncate", &ftruncate)(fd, nSize), [&] { Recorder::Changed(PathOf(fd), "truncate"); });
}
int fchmod(int fd, mode_t nMode) noexcept {
    return Told(Real("fchmod", &fchmod)(fd, nMode), [&] { Recorder::Changed(PathOf(fd), "chmod"); });
}
int chmod(const char* szPath, mode_t nMode) noexcept {
    return Told(Real("chmod", &chmod)(szPath, nMode), [&] { Recorder::Changed(szPath, "chmod"); });
}
int fchown(int fd, uid_t nUser, gid_t nGroup) noexcept {
    return Told(Real("fchown", &fchown)(fd, nUser, nGroup), [&] { Recorder::Changed(PathOf(fd), "chown"); });
}
int chown(const char* szPath, uid_t nUser, gid_t nGroup) noexcept {
    return Told(Real("chown", &chown)(szPath, nUser, nGroup), [&] { Recorder::Changed(szPath, "chown"); });
}
int fsync(int fd) {
    struct stat status = {};
    if (gBlDirectoriesFail && fstat(fd, &status) == 0 && S_ISDIR(status.st_mode)) {
        errno = EIO;
        return -1;
    }
    return Told(Real("fsync", &fsync)(fd), [&] { Recorder::Flushed(fd, false); });
}
int fdatasync(int fd) {
    return Told(Real("fdatasync", &fdatasync)(fd), [&] { Recorder::Flushed(fd, false); });
}
int syncfs(int fd) noexcept {
    return Told(Real("syncfs", &syncfs)(fd), [&] { Recorder::Flushed(fd, true); });
}
int unlink(const char* szPath) noexcept {
    ChangeName();
    return Told(Real("unlink", &unlink)(szPath), [&] { Recorder::Names("unlink", {szPath}); });
}
int remove(const char* szPath) noexcept {
    return Told(Real("remove", &remove)(szPath), [&] { Recorder::Names("unlink", {szPath}); });
}
int rmdir(const char* szPath) noexcept {
    return Told(Real("rmdir", &rmdir)(szPath), [&] { Recorder::Names("rmdir", {szPath}); });
}
int unlinkat(int fdDir, const char* szPath, int nFlags) noexcept {
    return Told(Real("unlinkat", &unlinkat)(fdDir, szPath, nFlags),
                [&] { Recorder::Names("unlink", {At(fdDir, szPath)}); });
}
int rename(const char* szFrom, const char* szTo) noexcept {
    ChangeName();
    if (gSzFailRename == szFrom) {
        gSzFailRename.clear();
        return -1;
    }
    return Told(Real("rename", &rename)(szFrom, szTo), [&] { Recorder::Names("rename", {szFrom, szTo}); });
}
int renameat2(int fdFrom, const char* szFrom, int fdTo, const char* szTo, unsigned nFlags) noexcept {
    if (gNRenamesLeft >= 0 && gNRenamesLeft-- == 0) {
        raise(gBlKilled ? SIGKILL : 0);
        errno = EIO;
        return -1;
    }
    if (!gBlExchanges && nFlags == RENAME_EXCHANGE) {
        errno = EINVAL;
        return -1;
    }
    return Told(Real("renameat2", &renameat2)(fdFrom, szFrom, fdTo, szTo, nFlags), [&] {
        Recorder::Names("rename", {At(fdFrom, szFrom), At(fdTo, szTo)});
    });
}
int link(const char* szFrom, const char* szTo) noexcept {
    return Told(Real("link", &link)(szFrom, szTo), [&] { Recorder::Names("link", {szTo}); });
}
int symlink(const char* szTarget, const char* szPath) noexcept {
    return Told(Real("symlink", &symlink)(szTarget, szPath), [&] { Recorder::Made(szPath); });
}
int mkdir(const char* szPath, mode_t nMode) noexcept {
    return Told(Real("mkdir", &mkdir)(szPath, nMode), [&] { Recorder::Made(szPath); });
}
char* mkdtemp(char* szPath) noexcept {
    char* szMade = Real("mkdtemp", &mkdtemp)(szPath);
    Told(szMade == nullptr ? -1 : 0, [&] { Recorder::Made(szPath); });
    return szMade;
}
int stat(const char* szPath, struct stat* pStatus) noexcept {
    const int nResult = Real("stat", static_cast<int (*)(const char*, struct stat*)>(&stat))(szPath, pStatus);
    Pretend(pStatus);
    return nResult;
}
int fstat(int fd, struct stat* pStatus) noexcept {
    const int nResult = Real("fstat", &fstat)(fd, pStatus);
    std::error_code error;
    if (!gSzForeign.empty() && fs::read_symlink(PathOf(fd), error) == gSzForeign) {
        pStatus->st_uid = 1000;
    }
    Pretend(pStatus);
    return nResult;
}
}
