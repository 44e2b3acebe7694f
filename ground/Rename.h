// rename with what Linux can do beyond it: RENAME_NOREPLACE, RENAME_EXCHANGE. Relies on renameat2.
#pragma once

#include <fcntl.h>

#include <cstdio>

namespace tavo {

// False with errno set.
inline bool Rename(const char* szFrom, const char* szTo, unsigned nFlags) {
    return renameat2(AT_FDCWD, szFrom, AT_FDCWD, szTo, nFlags) == 0;
}

}  // namespace tavo
