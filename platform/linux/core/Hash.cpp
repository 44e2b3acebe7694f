// String hashes that keep insertion order, and string lists.
// Relies on the standard library. Promises: no exception leaves; memory that ran out is NULL or -1.
#include <exception>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "ground/Border.h"
#include "ground/Fail.h"
#include "tavo/core.h"

namespace {

struct Entry {
    std::string szKey;
    std::optional<std::string> szValue;
};

}  // namespace

struct tag_TLIBC_SZHASH {
    std::vector<Entry> rgEntries;
    std::unordered_map<std::string, size_t> mapIndex;
};

struct tag_TLIBC_SZLIST {
    std::vector<std::string> rgItems;
};

using tavo::AtBorder;
using tavo::Fail;

TLIBCSzHash* TLIBCSzHashAlloc(int nSize) {
    return AtBorder(static_cast<TLIBCSzHash*>(nullptr), [nSize] {
        if (nSize < 0) {
            return Fail(TLIBC_ERR_BAD_PARAMETER, static_cast<TLIBCSzHash*>(nullptr));
        }
        return std::make_unique<TLIBCSzHash>().release();  // the size is a hint; most sections are small
    });
}

void TLIBCSzHashFree(TLIBCSzHash* pHash) {
    delete pHash;
}

const char* TLIBCSzHashGetValue(const TLIBCSzHash* pHash, const char* szKey) {
    return AtBorder(static_cast<const char*>(nullptr), [&]() -> const char* {
        if (pHash == nullptr || szKey == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER, nullptr);
        }
        const auto it = pHash->mapIndex.find(szKey);
        if (it == pHash->mapIndex.end() || !pHash->rgEntries[it->second].szValue) {
            return nullptr;
        }
        return pHash->rgEntries[it->second].szValue->c_str();
    });
}

int TLIBCSzHashSetValue(TLIBCSzHash* pHash, const char* szKey, const char* szValue) {
    return AtBorder(-1, [&] {
        if (pHash == nullptr || szKey == nullptr || *szKey == '\0') {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        std::optional<std::string> szCopy;
        if (szValue != nullptr) {
            szCopy = szValue;
        }
        const auto it = pHash->mapIndex.find(szKey);
        if (it != pHash->mapIndex.end()) {
            pHash->rgEntries[it->second].szValue = std::move(szCopy);
            return 1;
        }
        Entry entry{szKey, std::move(szCopy)};
        pHash->rgEntries.push_back(std::move(entry));
        try {
            pHash->mapIndex.emplace(szKey, pHash->rgEntries.size() - 1);
        } catch (...) {
            pHash->rgEntries.pop_back();
            throw;
        }
        return 1;
    });
}

int TLIBCSzHashCount(const TLIBCSzHash* pHash) {
    return pHash == nullptr ? Fail(TLIBC_ERR_BAD_PARAMETER) : static_cast<int>(pHash->rgEntries.size());
}

int TLIBCSzHashGetAt(const TLIBCSzHash* pHash, int nIndex, const char** pszKey, const char** pszValue) {
    if (pHash == nullptr || pszKey == nullptr || pszValue == nullptr || nIndex < 0 ||
        static_cast<size_t>(nIndex) >= pHash->rgEntries.size()) {
        return 0;
    }
    const Entry& entry = pHash->rgEntries[static_cast<size_t>(nIndex)];
    *pszKey = entry.szKey.c_str();
    *pszValue = entry.szValue ? entry.szValue->c_str() : nullptr;
    return 1;
}

TLIBCSzList* TLIBCSzListAlloc(int nSize) {
    return AtBorder(static_cast<TLIBCSzList*>(nullptr), [nSize] {
        if (nSize < 0) {
            return Fail(TLIBC_ERR_BAD_PARAMETER, static_cast<TLIBCSzList*>(nullptr));
        }
        return std::make_unique<TLIBCSzList>().release();
    });
}

void TLIBCSzListFree(TLIBCSzList* pList) {
    delete pList;
}

int TLIBCSzListPush(TLIBCSzList* pList, const char* szItem) {
    return AtBorder(-1, [&] {
        if (pList == nullptr || szItem == nullptr) {
            return Fail(TLIBC_ERR_BAD_PARAMETER);
        }
        pList->rgItems.emplace_back(szItem);
        return 1;
    });
}

const char* TLIBCSzListGet(const TLIBCSzList* pList, int nIndex) {
    if (pList == nullptr || nIndex < 0 || static_cast<size_t>(nIndex) >= pList->rgItems.size()) {
        return nullptr;
    }
    return pList->rgItems[static_cast<size_t>(nIndex)].c_str();
}

int TLIBCSzListCount(const TLIBCSzList* pList) {
    return pList == nullptr ? Fail(TLIBC_ERR_BAD_PARAMETER) : static_cast<int>(pList->rgItems.size());
}
