// A disk whose power is cut: what a writer does is recorded, and every state that a cut may leave is built for readers.
//
// The model. A file holds what it held at its last flush, or anything between that and what was written since: all of
// it, none, its first half, or as many zeros; its rights likewise. Names in a directory last once the directory was
// flushed after they changed. Until then any of the changes may be lost and others not, in whatever order, but two
// changes of one name keep theirs, and a rename, which every file system journals as one, is never half done. A rename
// between two directories lasts with the flush of the one that it leads to. syncfs flushes everything.
#pragma once

#include <sys/stat.h>

#include <cstdint>
#include <functional>
#include <map>
#include <string>
#include <utility>
#include <vector>

class Disk {
public:
    // Each place becomes an empty file system of its own as long as the object lives.
    explicit Disk(std::vector<std::string> rgszPlaces);
    ~Disk();
    Disk(const Disk&) = delete;
    Disk& operator=(const Disk&) = delete;

    // Once for each object. What stands there before is on the disk for good.
    void Record(const std::function<void()>& fnWork);
    // Calls fnLook in every state, with the number of marks that the writer had passed; how the state came about is
    // what the test is told when it fails. blTwice: what fnLook itself changes is cut off as well, and looked at once
    // more. The number of states.
    int ForEachCut(const std::function<void(size_t nMarks)>& fnLook, bool blTwice = false);
    // Whether the disk has lost nothing and nobody got past the recorder.
    bool IsWhole() const;

private:
    friend struct Recorder;
    using Id = uint64_t;  // a device and an inode
    using Name = std::pair<Id, std::string>;
    using Names = std::map<Name, Id>;
    struct Inode {
        mode_t nMode = 0;
        uid_t nUser = 0;
        gid_t nGroup = 0;
        timespec changed = {};
        std::string szData;  // a file's content, a link's target
    };
    using Inodes = std::map<Id, Inode>;
    struct Event {
        std::vector<std::pair<Name, Id>> rgNames;  // what stands under them from now on; 0: nothing
        Id nInode = 0;                             // that has changed, or is flushed
        Inode inode;
        bool blFlush = false;
        bool blMark = false;
        std::string szText;
    };
    struct Search;

    enum class AsTheyAre {};
    Disk(std::vector<std::string> rgszPlaces, AsTheyAre) : mRgszPlaces(std::move(rgszPlaces)), mBlMounted(false) {}
    void Take(const std::string& szDir);
    Id Root(size_t i) const;
    void Put(const Names& names, const Inodes& inodes, Id nDir, const std::string& szDir,
             std::map<Id, std::string>& mapMade);
    static std::string Text(const Names& names, const Inodes& inodes, Id nDir);

    std::vector<std::string> mRgszPlaces;
    bool mBlMounted = true;
    Names mNames;
    Inodes mInodes;
    std::vector<Event> mRgEvents;
};

// What a writer has promised by now: a point in the record.
void Mark();

// Flushes of directories fail, as on a dying disk.
extern bool gBlDirectoriesFail;
