// Counts address translations from the evidence. Relies on the address blocks set aside for private and
// carriers' networks. Promises: see Level.h.
#include "ground/net/Level.h"

namespace tavo {

namespace {

struct Block {
    uint32_t nNetwork;
    unsigned nPrefix;
    AddressKind enKind;
};

constexpr Block kBlocks[] = {
    {0x00000000, 8, AddressKind::kNone},      // this network
    {0x0A000000, 8, AddressKind::kPrivate},   // 10/8
    {0x64400000, 10, AddressKind::kCarrier},  // 100.64/10
    {0x7F000000, 8, AddressKind::kNone},      // loopback
    {0xA9FE0000, 16, AddressKind::kNone},     // link-local
    {0xAC100000, 12, AddressKind::kPrivate},  // 172.16/12
    {0xC0A80000, 16, AddressKind::kPrivate},  // 192.168/16
    {0xE0000000, 3, AddressKind::kNone},      // multicast and reserved
};

// The networks between the box and the public one, each counted once. Behind a carrier's translation
// its own routers may be numbered privately: that is no further translation.
class Translations {
public:
    void Pass(AddressKind enKind) {
        if (enKind == AddressKind::kCarrier) {
            mBlCarrier = true;
        } else if (enKind == AddressKind::kPrivate && !mBlCarrier) {
            mBlPrivate = true;
        }
    }
    bool IsOneOnly() const { return !mBlPrivate && !mBlCarrier; }
    int Level() const { return 1 + (mBlPrivate ? 1 : 0) + (mBlCarrier ? 1 : 0); }

private:
    bool mBlPrivate = false;
    bool mBlCarrier = false;
};

}  // namespace

AddressKind KindOf(const in_addr& address) {
    const uint32_t nAddress = ntohl(address.s_addr);
    for (const Block& block : kBlocks) {
        if (nAddress >> (32U - block.nPrefix) == block.nNetwork >> (32U - block.nPrefix)) {
            return block.enKind;
        }
    }
    return AddressKind::kPublic;
}

std::optional<int> LevelOf(const LevelEvidence& evidence) {
    const AddressKind enOwn = KindOf(evidence.own);
    if (enOwn == AddressKind::kPublic) {
        return 0;
    }
    Translations translations;
    if (enOwn == AddressKind::kCarrier) {
        translations.Pass(enOwn);
    }
    const AddressKind enExternal = evidence.external ? KindOf(*evidence.external) : AddressKind::kNone;
    if (enExternal == AddressKind::kPublic && !evidence.blExternalElsewhere) {
        return translations.Level();
    }
    translations.Pass(enExternal);
    bool blPublicSeen = enExternal == AddressKind::kPublic;
    for (const std::optional<in_addr>& router : evidence.rgBeyond) {
        const AddressKind enKind = router ? KindOf(*router) : AddressKind::kNone;
        if (enKind == AddressKind::kPublic) {
            blPublicSeen = true;
            break;
        }
        translations.Pass(enKind);
    }
    return translations.IsOneOnly() && !blPublicSeen ? std::nullopt : std::optional<int>(translations.Level());
}

}  // namespace tavo
