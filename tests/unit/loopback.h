// Sockets on the loopback device.
#pragma once

#include <arpa/inet.h>
#include <gtest/gtest.h>
#include <sys/socket.h>

#include <span>
#include <string>
#include <vector>

#include "ground/Descriptor.h"
#include "tavo/core.h"

inline sockaddr_in AddressOf(const char* szAddress, uint16_t nPort = 0) {
    sockaddr_in address = {};
    address.sin_family = AF_INET;
    address.sin_port = htons(nPort);
    inet_pton(AF_INET, szAddress, &address.sin_addr);
    return address;
}

inline tavo::Descriptor SocketAt(const char* szAddress, uint16_t nPort = 0, int nKind = SOCK_DGRAM) {
    tavo::Descriptor fd(socket(AF_INET, nKind | SOCK_CLOEXEC, 0));
    const sockaddr_in own = AddressOf(szAddress, nPort);
    EXPECT_EQ(bind(fd.Get(), reinterpret_cast<const sockaddr*>(&own), sizeof(own)), 0);
    return fd;
}

inline uint16_t PortOf(const tavo::Descriptor& fd) {
    sockaddr_in own = {};
    socklen_t nLength = sizeof(own);
    EXPECT_EQ(getsockname(fd.Get(), reinterpret_cast<sockaddr*>(&own), &nLength), 0);
    return ntohs(own.sin_port);
}

// As a text or as bytes.
template <typename Message>
void Send(int fd, const Message& message, const sockaddr_in& to) {
    EXPECT_EQ(sendto(fd, message.data(), message.size(), 0, reinterpret_cast<const sockaddr*>(&to), sizeof(to)),
              static_cast<ssize_t>(message.size()));
}

// Its length; negative: nothing came.
inline ssize_t Receive(int fd, std::span<char> rgMessage, sockaddr_in& from, int nFlags = 0) {
    socklen_t nLength = sizeof(from);
    return recvfrom(fd, rgMessage.data(), rgMessage.size(), nFlags, reinterpret_cast<sockaddr*>(&from), &nLength);
}

// What a socket then says to a group goes to all that listen on its own device.
inline const tavo::Descriptor& ToAll(const tavo::Descriptor& fd, const char* szOwn) {
    const in_addr own = AddressOf(szOwn).sin_addr;
    EXPECT_EQ(setsockopt(fd.Get(), IPPROTO_IP, IP_MULTICAST_IF, &own, sizeof(own)), 0);
    return fd;
}

// Has more addresses on it, for as long as this lives.
class LoopbackHosts {
public:
    LoopbackHosts(std::initializer_list<const char*> rgszHosts) : mRgszHosts(rgszHosts.begin(), rgszHosts.end()) {
        for (const std::string& szHost : mRgszHosts) {
            EXPECT_EQ(TLIBCSystem(("ip address add dev lo " + szHost).c_str()), 0);
        }
    }
    ~LoopbackHosts() {
        for (const std::string& szHost : mRgszHosts) {
            TLIBCSystem(("ip address del dev lo " + szHost + "/32 2>/dev/null").c_str());
        }
    }
    LoopbackHosts(const LoopbackHosts&) = delete;
    LoopbackHosts& operator=(const LoopbackHosts&) = delete;

private:
    std::vector<std::string> mRgszHosts;
};
