// What lies in a directory. Relies on readdir: the standard library's iterators end the process when
// memory runs out. Promises: all names or none, without "." and "..", in no order.
#pragma once

#include <dirent.h>

#include <cerrno>
#include <memory>
#include <optional>
#include <string>
#include <vector>

namespace tavo {

// Nothing when the directory cannot be read.
inline std::optional<std::vector<std::string>> NamesIn(const std::string& szDir) {
    const std::unique_ptr<DIR, decltype([](DIR* pDir) { closedir(pDir); })> pDir(opendir(szDir.c_str()));
    if (!pDir) {
        return std::nullopt;
    }
    std::vector<std::string> rgszNames;
    errno = 0;
    while (const dirent* pEntry = readdir(pDir.get())) {
        const std::string szName = pEntry->d_name;
        if (szName != "." && szName != "..") {
            rgszNames.push_back(szName);
        }
        errno = 0;
    }
    return errno == 0 ? std::optional(std::move(rgszNames)) : std::nullopt;
}

}  // namespace tavo
