// What the port tester and the port checker say to each other: one POST of JSON, and its answer.
// Relies on jsoncpp. Promises: both sides use the same words, and read them strictly.
//
//   POST /v1/ports                      Authorization: Bearer TOKEN
//   {"version":1,"probe":"...","answer":"...","ports":[{"protocol":"tcp","port":5001,"challenge":false}]}
//   {"version":1,"address":"203.0.113.2","results":[{"protocol":"tcp","port":5001,"state":"open",
//    "answered":false,"source":41234}]}
//
// The checker connects back to the address that asked. To a UDP port, and to a TCP port with a challenge, it
// sends "probe:PORT" and a line feed, and "answered" says whether "answer:PORT" came back. "source" is the
// port that it called from. A TCP connection is kept open for a moment after the answer, so that the box can
// look at it.
#pragma once

#include <json/json.h>

#include <cstdint>
#include <optional>
#include <string>

namespace tavo {

inline constexpr char kCheckPath[] = "/v1/ports";
inline constexpr int kCheckVersion = 1;
inline constexpr size_t kNonceLength = 32;  // of probe and answer, hexadecimal digits

enum class PortState {
    kOpen,         // TCP: connected; UDP: answered
    kRefused,      // a reset, or word that nobody has the port
    kTimeout,      // nothing came back
    kUnreachable,  // a router or firewall on the way said no
    kUntold        // the checker could not try it
};
inline constexpr const char* kPortStateWords[] = {"open", "refused", "timeout", "unreachable", "untold"};

struct CheckedPort {
    bool blTcp;
    uint16_t nPort;
    bool blChallenge = false;  // TCP only; UDP always is
};

struct PortFinding {
    PortState enState = PortState::kUntold;
    bool blAnswered = false;
    uint16_t nSource = 0;  // 0: unknown
};

inline const char* ProtocolWord(bool blTcp) {
    return blTcp ? "tcp" : "udp";
}

// What is sent to, and expected from, one port.
inline std::string Challenge(const std::string& szNonce, uint16_t nPort) {
    return szNonce + ":" + std::to_string(nPort) + "\n";
}

// A JSON object and nothing else; nothing for other text, for keys that come twice and for deep nesting.
std::optional<Json::Value> ParseMessage(const std::string& szText);
std::string FormatMessage(const Json::Value& jsMessage);

}  // namespace tavo
