// One host's address, of either family. Relies on inet_pton. Promises: an IPv4 address that comes in IPv6's
// clothes (::ffff:a.b.c.d) is that IPv4 address.
#pragma once

#include <netinet/in.h>
#include <sys/socket.h>

#include <compare>
#include <cstdint>
#include <optional>
#include <string>

namespace tavo {

class Address {
public:
    static std::optional<Address> Parse(const std::string& szText);
    static Address Of(const sockaddr_storage& socketAddress);

    std::string Text() const;
    sockaddr_storage WithPort(uint16_t nPort) const;
    int Family() const { return mBlV4 ? AF_INET : AF_INET6; }
    // Those who hold an IPv6 address hold the /64 around it: it counts as one.
    Address Owner() const;
    // May be told by a proxy: one single host that is not this one.
    bool IsForeignHost() const;
    // clang-tidy 14 takes the zero that the compiler itself compares with for a null pointer.
    auto operator<=>(const Address& other) const = default;  // NOLINT(modernize-use-nullptr)

private:
    Address() = default;
    in_addr V4() const;
    in6_addr V6() const;

    bool mBlV4 = false;
    std::string mSzBytes;  // 4 or 16
};

}  // namespace tavo
