// The detection cache: what is known of the gateway, kept between two calls. Relies on the platform's
// sectioned files and string hashes. Promises: the file never holds more than one section; a cache that
// cannot be read only makes readers fail.
#include <unistd.h>

#include <cstring>
#include <iterator>

#include "Border.h"
#include "Log.h"
#include "ReplaceFile.h"
#include "Sections.h"
#include "libtavoportmap.h"

const std::string SZF_DETECT_MANUAL_CACHE = "/etc/portforward/router_detect.cache";
const std::string SZ_ROUER_INIT = "router_detect";

namespace {

constexpr char kFile[] = "src/DetectCache.cpp";
constexpr char kBrand[] = "brand";
constexpr char kModel[] = "model";
constexpr char kVersion[] = "version";

// By their values.
constexpr const char* kStateWords[] = {"unknown", "not_initialized", "upnp_natpmp", "manual"};

using tavo::lib::AtBorder;
using tavo::lib::LogError;
using tavo::lib::Refuse;

enum ReaderState : int { kNotInitialized = 0, kFailed = 1, kSectionFound = 2, kSectionAbsent = 3 };

const char* StateText(int enReaderState) {
    switch (enReaderState) {
        case kNotInitialized:
            return "not initialized";
        case kFailed:
            return "failed";
        case kSectionAbsent:
            return "section not existed";
        default:
            return "";
    }
}

bool IsState(int enState) {
    return enState >= 0 && enState < static_cast<int>(std::size(kStateWords));
}

// The stored text of a key, once the section has been found; szRefusal takes the file, the line and the
// reader's state.
const char* Stored(int enReaderState, const tag_TLIBC_SZHASH* pHash, const char* szKey, const char* szRefusal,
                   int nLine) {
    if (enReaderState != kSectionFound) {
        LogError(szRefusal, kFile, nLine, StateText(enReaderState));
        return nullptr;
    }
    if (pHash == nullptr) {
        LogError("%s:%d mPHash is NULL", kFile, nLine);
        return nullptr;
    }
    const char* szValue = TLIBCSzHashGetValue(pHash, szKey);
    if (szValue == nullptr) {
        LogError("%s:%d TLIBCSzHashGetValue(%s) failed", kFile, nLine, szKey);
    }
    return szValue;
}

int ReadText(std::string& szText, const char* szStored) {
    return AtBorder(0, [&] {
        if (szStored == nullptr) {
            return 0;
        }
        szText = szStored;
        return 1;
    });
}

int Store(tag_TLIBC_SZHASH* pHash, const char* szKey, const char* szValue, int nLine) {
    if (TLIBCSzHashSetValue(pHash, szKey, szValue) < 0) {
        LogError("%s:%d TLIBCSzHashSetValue(%s, %s) failed", kFile, nLine, szKey, szValue);
        return 0;
    }
    return 1;
}

// The first step of every setter but SetType().
bool IsReady(DetectCacheWriter& writer, int nLine) {
    return writer.Init() != 0 || Refuse("%s:%d Init() failed", kFile, nLine);
}

}  // namespace

namespace DetectCache {

std::string ToString(__TAG_TAVO_ROUTER_INIT_STATE enState) {
    if (!IsState(enState)) {
        LogError("%s:%d non supported enState=%d", kFile, __LINE__, static_cast<int>(enState));
        return "";
    }
    return kStateWords[enState];
}

bool IsCacheExisted() {
    return TLIBCFileExist(SZF_DETECT_MANUAL_CACHE.c_str()) == 1;
}

}  // namespace DetectCache

// ---- reader ------------------------------------------------------------------------------------------

DetectCacheReader::DetectCacheReader(const std::string& section)
    : mEnReaderState(kNotInitialized), mPHash(nullptr), mSzSection(section) {}

DetectCacheReader::~DetectCacheReader() {
    TLIBCSzHashFree(mPHash);
}

int DetectCacheReader::Init() {
    if (mPHash != nullptr) {
        return 1;
    }
    mPHash = TLIBCSzHashAlloc(tavo::lib::kHashSize);
    if (mPHash == nullptr) {
        LogError("%s:%d hash malloc failed", kFile, __LINE__);
        return 0;
    }
    const int nKeys = TLIBCFileGetSection(SZF_DETECT_MANUAL_CACHE.c_str(), mSzSection.c_str(), mPHash);
    if (nKeys < 0) {
        LogError("%s:%d TLIBCFileGetSection(%s, %s)=%d failed[0x%04X %s:%d]", kFile, __LINE__,
                 SZF_DETECT_MANUAL_CACHE.c_str(), mSzSection.c_str(), nKeys, static_cast<unsigned>(TLIBCErrGet()),
                 TLIBCErrorGetFile(), TLIBCErrorGetLine());
        mEnReaderState = kFailed;
        return 0;
    }
    mEnReaderState = nKeys > 0 ? kSectionFound : kSectionAbsent;
    return 1;
}

int DetectCacheReader::IsSectionExisted(bool& blExisted) {
    if (mPHash == nullptr && Init() == 0) {
        LogError("%s:%d Init() failed", kFile, __LINE__);
        return 0;
    }
    if (mPHash == nullptr) {
        LogError("%s:%d mPHash is NULL", kFile, __LINE__);
        return 0;
    }
    if (mEnReaderState == kNotInitialized) {
        LogError("%s:%d reader state=not initialized", kFile, __LINE__);
        return 0;
    }
    if (mEnReaderState == kFailed) {
        LogError("%s:%d initialize failed", kFile, __LINE__);
        return 0;
    }
    blExisted = mEnReaderState == kSectionFound;
    return 1;
}

int DetectCacheReader::GetType(__TAG_TAVO_ROUTER_INIT_STATE& enState) {
    // The wording is that of GetVersion(), for both.
    const char* szValue = Stored(mEnReaderState, mPHash, SZ_ROUER_INIT.c_str(),
                                 "%s:%d can not GetVersion(), mEnReaderState=%s", __LINE__);
    if (szValue == nullptr) {
        return 0;
    }
    for (size_t i = 0; i < std::size(kStateWords); ++i) {
        if (std::strcmp(szValue, kStateWords[i]) == 0) {
            enState = static_cast<__TAG_TAVO_ROUTER_INIT_STATE>(i);
            return 1;
        }
    }
    LogError("%s:%d invalid szValue=%s", kFile, __LINE__, szValue);
    return 0;
}

int DetectCacheReader::GetBrand(std::string& brand) {
    return ReadText(brand,
                    Stored(mEnReaderState, mPHash, kBrand, "%s:%d can not GetBrand(), mEnReaderState=%s", __LINE__));
}

int DetectCacheReader::GetModel(std::string& model) {
    return ReadText(model,
                    Stored(mEnReaderState, mPHash, kModel, "%s:%d can not GetModel(), mEnReaderState=%s", __LINE__));
}

int DetectCacheReader::GetVersion(std::string& version) {
    return ReadText(
        version, Stored(mEnReaderState, mPHash, kVersion, "%s:%d can not GetVersion(), mEnReaderState=%s", __LINE__));
}

// ---- writer ------------------------------------------------------------------------------------------

DetectCacheWriter::DetectCacheWriter(const std::string& section) : mPHash(nullptr), mSzSection(section) {}

DetectCacheWriter::~DetectCacheWriter() {
    TLIBCSzHashFree(mPHash);
}

int DetectCacheWriter::Init() {
    if (mPHash == nullptr) {
        mPHash = TLIBCSzHashAlloc(tavo::lib::kHashSize);
    }
    if (mPHash == nullptr) {
        LogError("%s:%d hash malloc failed", kFile, __LINE__);
        return 0;
    }
    return 1;
}

int DetectCacheWriter::SetType(__TAG_TAVO_ROUTER_INIT_STATE enState) {
    if (!IsState(enState)) {
        LogError("%s:%d error: invalid enume type enState=%d", kFile, __LINE__, static_cast<int>(enState));
        return 0;
    }
    return Store(mPHash, SZ_ROUER_INIT.c_str(), kStateWords[enState], __LINE__);
}

int DetectCacheWriter::SetBrand(const std::string& brand) {
    return IsReady(*this, __LINE__) ? Store(mPHash, kBrand, brand.c_str(), __LINE__) : 0;
}

int DetectCacheWriter::SetModel(const std::string& model) {
    return IsReady(*this, __LINE__) ? Store(mPHash, kModel, model.c_str(), __LINE__) : 0;
}

int DetectCacheWriter::SetVersion(const std::string& version) {
    return IsReady(*this, __LINE__) ? Store(mPHash, kVersion, version.c_str(), __LINE__) : 0;
}

int DetectCacheWriter::Sync() {
    const tavo::lib::OwnerAndMode old(SZF_DETECT_MANUAL_CACHE.c_str());
    CleanDetectManualCache();
    if (TLIBCFileAddSection(SZF_DETECT_MANUAL_CACHE.c_str(), mSzSection.c_str(), mPHash, 0) != 1) {
        LogError("%s:%d TLIBCFileAddSection() failed[0x%04X %s:%d]", kFile, __LINE__,
                 static_cast<unsigned>(TLIBCErrGet()), TLIBCErrorGetFile(), TLIBCErrorGetLine());
        return 0;
    }
    old.GiveTo(SZF_DETECT_MANUAL_CACHE.c_str());
    return 1;
}

// ---- the manual router ---------------------------------------------------------------------------------

int SetDetectManualCache(const std::string& section, const std::string& brand, const std::string& model,
                         const std::string& version) {
    return AtBorder(0, [&] {
        DetectCacheWriter writer(section);
        if (writer.SetBrand(brand) == 0) {
            LogError("%s:%d set brand failed", kFile, __LINE__);
            return 0;
        }
        if (writer.SetModel(model) == 0) {
            LogError("%s:%d set model failed", kFile, __LINE__);
            return 0;
        }
        if (writer.SetVersion(version) == 0) {
            LogError("%s:%d set version failed", kFile, __LINE__);
            return 0;
        }
        if (writer.SetType(TAVO_ROUTER_INIT_STATE_MANUAL) == 0) {
            LogError("%s:%d set type failed", kFile, __LINE__);
            return 0;
        }
        if (writer.Sync() == 0) {
            LogError("%s:%d Sync() failed", kFile, __LINE__);
            return 0;
        }
        return 1;
    });
}

int CleanDetectManualCache() {
    if (DetectCache::IsCacheExisted()) {
        unlink(SZF_DETECT_MANUAL_CACHE.c_str());
    }
    return 1;
}
