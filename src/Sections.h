// Owners of what the platform hands out, and the sections of a file that is being built. Relies on the platform's
// files and hashes. Promises: nothing is thrown.
#pragma once

#include <cstdlib>
#include <memory>
#include <string>

#include "tavo/core.h"
#include "tavo/portforward.h"

namespace tavo::lib {

inline constexpr int kHashSize = 1024;

struct FreeDeleter {
    void operator()(void* pBlock) const { std::free(pBlock); }
};

struct ConfListDeleter {
    void operator()(TAVO_PF_CONF* pHead) const { TAVOPFConfFree(pHead); }
};
using ConfList = std::unique_ptr<TAVO_PF_CONF, ConfListDeleter>;

struct HashDeleter {
    void operator()(TLIBCSzHash* pHash) const { TLIBCSzHashFree(pHash); }
};
using Hash = std::unique_ptr<TLIBCSzHash, HashDeleter>;

// A node with an empty hash, named szName. Null when memory ran out: szNoNode or szNoHash is logged with
// szFile and nLine. Both formats take the file and the line.
ConfList NewSection(const std::string& szName, const char* szNoNode, const char* szNoHash, const char* szFile,
                    int nLine);

}  // namespace tavo::lib
