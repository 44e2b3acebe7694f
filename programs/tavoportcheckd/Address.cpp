// Addresses as bytes. Relies on the system's address functions. Promises: see Address.h.
#include "programs/tavoportcheckd/Address.h"

#include <arpa/inet.h>
#include <ifaddrs.h>

#include <cstring>
#include <memory>

namespace tavo {

namespace {

constexpr size_t kOwnerBytes = 8;

template <typename Bytes>
std::string ToBytes(const Bytes& bytes) {
    return {reinterpret_cast<const char*>(&bytes), sizeof(bytes)};
}

bool IsThisHost(const Address& address) {
    ifaddrs* pRaw = nullptr;
    if (getifaddrs(&pRaw) != 0) {
        return true;  // better refused than connected to ourselves
    }
    const std::unique_ptr<ifaddrs, decltype([](ifaddrs* pAll) { freeifaddrs(pAll); })> pAll(pRaw);
    for (const ifaddrs* pOne = pAll.get(); pOne != nullptr; pOne = pOne->ifa_next) {
        const int nFamily = pOne->ifa_addr == nullptr ? AF_UNSPEC : pOne->ifa_addr->sa_family;
        sockaddr_storage own = {};
        if (nFamily == AF_INET || nFamily == AF_INET6) {
            std::memcpy(&own, pOne->ifa_addr, nFamily == AF_INET ? sizeof(sockaddr_in) : sizeof(sockaddr_in6));
            if (Address::Of(own) == address) {
                return true;
            }
        }
    }
    return false;
}

}  // namespace

std::optional<Address> Address::Parse(const std::string& szText) {
    in_addr v4 = {};
    in6_addr v6 = {};
    Address address;
    if (inet_pton(AF_INET, szText.c_str(), &v4) == 1) {
        address.mBlV4 = true;
        address.mSzBytes = ToBytes(v4);
        return address;
    }
    if (inet_pton(AF_INET6, szText.c_str(), &v6) != 1) {
        return std::nullopt;
    }
    sockaddr_storage storage = {};
    auto& in6 = reinterpret_cast<sockaddr_in6&>(storage);
    in6.sin6_family = AF_INET6;
    in6.sin6_addr = v6;
    return Of(storage);
}

Address Address::Of(const sockaddr_storage& socketAddress) {
    Address address;
    if (socketAddress.ss_family == AF_INET) {
        address.mBlV4 = true;
        address.mSzBytes = ToBytes(reinterpret_cast<const sockaddr_in&>(socketAddress).sin_addr);
        return address;
    }
    const in6_addr& v6 = reinterpret_cast<const sockaddr_in6&>(socketAddress).sin6_addr;
    address.mBlV4 = IN6_IS_ADDR_V4MAPPED(&v6) != 0;
    address.mSzBytes = ToBytes(v6).substr(address.mBlV4 ? sizeof(in6_addr) - sizeof(in_addr) : 0);
    return address;
}

in_addr Address::V4() const {
    in_addr v4 = {};
    std::memcpy(&v4, mSzBytes.data(), sizeof(v4));
    return v4;
}

in6_addr Address::V6() const {
    in6_addr v6 = {};
    std::memcpy(&v6, mSzBytes.data(), sizeof(v6));
    return v6;
}

std::string Address::Text() const {
    char szText[INET6_ADDRSTRLEN] = {};
    inet_ntop(Family(), mSzBytes.data(), szText, sizeof(szText));
    return szText;
}

sockaddr_storage Address::WithPort(uint16_t nPort) const {
    sockaddr_storage storage = {};
    if (mBlV4) {
        auto& in = reinterpret_cast<sockaddr_in&>(storage);
        in.sin_family = AF_INET;
        in.sin_port = htons(nPort);
        in.sin_addr = V4();
    } else {
        auto& in6 = reinterpret_cast<sockaddr_in6&>(storage);
        in6.sin6_family = AF_INET6;
        in6.sin6_port = htons(nPort);
        in6.sin6_addr = V6();
    }
    return storage;
}

Address Address::Owner() const {
    Address owner = *this;
    if (!mBlV4) {
        owner.mSzBytes.replace(kOwnerBytes, std::string::npos, kOwnerBytes, '\0');
    }
    return owner;
}

bool Address::IsForeignHost() const {
    if (mBlV4) {
        const uint32_t nAddress = ntohl(V4().s_addr);
        const uint32_t nNetwork = nAddress >> 24U;
        if (nNetwork == 0 || nNetwork == IN_LOOPBACKNET || nNetwork >= 224 || nAddress >> 16U == 0xA9FE) {
            return false;
        }
    } else {
        const in6_addr v6 = V6();
        if (IN6_IS_ADDR_UNSPECIFIED(&v6) || IN6_IS_ADDR_LOOPBACK(&v6) || IN6_IS_ADDR_MULTICAST(&v6) ||
            IN6_IS_ADDR_LINKLOCAL(&v6)) {
            return false;
        }
    }
    return !IsThisHost(*this);
}

}  // namespace tavo
