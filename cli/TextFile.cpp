// Reads and replaces the tool's own files. Relies on POSIX files. Promises: see TextFile.h.
#include "TextFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <fstream>
#include <iostream>

namespace tavo::cli {

namespace {

constexpr size_t kMostOwnBytes = 64U << 20U;    // the rules twice, in JSON: a rule file has 16 MiB at most
constexpr size_t kMostUsersBytes = 16U << 20U;  // as many rules as a rule file holds
constexpr mode_t kOwnerOnly = 0600;

class File {
public:
    explicit File(int fd) : mFd(fd) {}
    ~File() { Close(); }
    File(const File&) = delete;
    File& operator=(const File&) = delete;
    int Fd() const { return mFd; }
    bool Close() {
        const bool blClosed = mFd < 0 || close(mFd) == 0;
        mFd = -1;
        return blClosed;
    }

private:
    int mFd;
};

bool IsOwn(const struct stat& status) {
    return S_ISREG(status.st_mode) && (status.st_uid == 0 || status.st_uid == geteuid()) &&
           (status.st_mode & (S_IWGRP | S_IWOTH)) == 0 && static_cast<size_t>(status.st_size) <= kMostOwnBytes;
}

bool WriteAll(int fd, const std::string& szText) {
    for (size_t nDone = 0; nDone < szText.size();) {
        const ssize_t nWritten = write(fd, szText.data() + nDone, szText.size() - nDone);
        if (nWritten < 0 && errno != EINTR) {
            return false;
        }
        nDone += nWritten < 0 ? 0 : static_cast<size_t>(nWritten);
    }
    return true;
}

// A name in a directory lasts only when the directory has been written, too.
bool FlushDirectoryOf(const std::string& szPath) {
    const File directory(open(szPath.substr(0, szPath.rfind('/') + 1).c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
    return directory.Fd() >= 0 && (fsync(directory.Fd()) == 0 || errno == EINVAL || errno == ENOTSUP);
}

}  // namespace

ReadState ReadOwnFile(const std::string& szPath, std::string& szText) {
    const File file(open(szPath.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    if (file.Fd() < 0) {
        return errno == ENOENT ? ReadState::kAbsent : ReadState::kUnreadable;
    }
    struct stat status = {};
    if (fstat(file.Fd(), &status) != 0 || !IsOwn(status)) {
        return ReadState::kUnreadable;
    }
    szText.assign(static_cast<size_t>(status.st_size), '\0');
    return read(file.Fd(), szText.data(), szText.size()) == status.st_size ? ReadState::kRead : ReadState::kUnreadable;
}

std::optional<std::string> ReadUsersFile(const std::string& szPath) {
    std::ifstream file(szPath);
    std::istream& stream = szPath == "-" ? std::cin : file;
    std::string szText(kMostUsersBytes + 1, '\0');
    stream.read(szText.data(), kMostUsersBytes + 1);
    szText.resize(static_cast<size_t>(stream.gcount()));
    return stream.eof() && !stream.bad() ? std::optional(szText) : std::nullopt;
}

bool WriteOwnFile(const std::string& szPath, const std::string& szText) {
    if (szText.size() > kMostOwnBytes) {
        return false;
    }
    const std::string szNew = szPath + ".new";
    unlink(szNew.c_str());  // of a writer that was killed
    File file(open(szNew.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC, kOwnerOnly));
    if (file.Fd() < 0) {
        return false;
    }
    if (!WriteAll(file.Fd(), szText) || fsync(file.Fd()) != 0 || !file.Close() ||
        std::rename(szNew.c_str(), szPath.c_str()) != 0) {
        unlink(szNew.c_str());
        return false;
    }
    return FlushDirectoryOf(szPath);
}

bool RemoveOwnFile(const std::string& szPath) {
    const bool blGone = unlink(szPath.c_str()) == 0 || errno == ENOENT ||
                        (errno == EISDIR && std::rename(szPath.c_str(), (szPath + ".aside").c_str()) == 0);
    return blGone && (FlushDirectoryOf(szPath) || errno == ENOENT);
}

}  // namespace tavo::cli
