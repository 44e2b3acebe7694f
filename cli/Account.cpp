// Keeps one account in a sectioned file. Relies on the seam's files, which create theirs for root alone. Promises: see
// Account.h.
#include "Account.h"

#include <unistd.h>

#include <memory>
#include <utility>

#include "tavo/core.h"

namespace tavo::cli {

namespace {

constexpr char kFile[] = "/etc/portforward/router_account.conf";
constexpr unsigned kFields = 4;

using Conf = __tag_TAVO_ROUTER_CONF;

struct Field {
    const char* szKey;
    int (RouterConfReader::*fnGet)(std::string&);
    char (Conf::*pSzField)[TAVO_TEXT_SIZE];
};

constexpr Field kAccount[kFields] = {{"user", &RouterConfReader::GetUser, &Conf::szUser},
                                     {"pass", &RouterConfReader::GetPass, &Conf::szPass},
                                     {"conn_type", &RouterConfReader::GetConnType, &Conf::szConnType},
                                     {"conn_port", &RouterConfReader::GetConnPort, &Conf::szConnPort}};

// Which router's they are: by these its description is found while they are not in use.
constexpr std::pair<const char*, int (RouterConfReader::*)(std::string&)> kIdentity[] = {
    {"brand", &RouterConfReader::GetBrand},
    {"model", &RouterConfReader::GetModel},
    {"version", &RouterConfReader::GetVersion}};

}  // namespace

bool KeepAccount(const std::string& szGateway) {
    RouterConfReader reader(szGateway);
    bool blExist = false;
    const std::unique_ptr<TLIBCSzHash, decltype(&TLIBCSzHashFree)> pHash(TLIBCSzHashAlloc(kFields), &TLIBCSzHashFree);
    if (!pHash || reader.IsSectionExist(blExist) == 0 || !blExist) {
        return pHash != nullptr;
    }
    bool blAny = false;
    for (const Field& field : kAccount) {
        std::string szValue;
        (reader.*field.fnGet)(szValue);
        blAny = blAny || !szValue.empty();
        TLIBCSzHashSetValue(pHash.get(), field.szKey, szValue.c_str());
    }
    if (!blAny) {
        return true;  // what was put aside before still counts
    }
    for (const auto& [szKey, fnGet] : kIdentity) {
        std::string szValue;
        (reader.*fnGet)(szValue);
        TLIBCSzHashSetValue(pHash.get(), szKey, szValue.c_str());
    }
    DropAccount();
    return TLIBCFileAddSection(kFile, szGateway.c_str(), pHash.get(), 0) == 1;
}

void BringAccount(const std::string& szGateway, Conf& conf) {
    // A user's password goes with this user only.
    const bool blOtherUser = *conf.szUser != '\0';
    for (const Field& field : kAccount) {
        auto& szField = conf.*field.pSzField;
        const bool blPassword = std::string_view(field.szKey) == "pass";
        if (*szField == '\0' && !(blPassword && blOtherUser)) {
            TLIBCFileGetSectionValue(kFile, szGateway.c_str(), field.szKey, szField, sizeof(szField));
        }
    }
}

void DropAccount() {
    unlink(kFile);
}

}  // namespace tavo::cli
