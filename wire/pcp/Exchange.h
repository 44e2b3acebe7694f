// One question to a gateway's port for NAT-PMP and PCP, and its answer. Relies on one connected UDP socket a
// question: nobody but the gateway can answer it, and no answer to the question before it comes there.
// Promises: ends within the limit, and soon after fnStop, where there is one, answers true.
#pragma once

#include <netinet/in.h>

#include <chrono>
#include <cstdint>
#include <functional>
#include <span>

namespace tavo {

enum class ExchangeEnd {
    kAnswered,
    kSilent,
    kGarbage,     // the gateway spoke, and nothing of it was an answer
    kUnreachable  // no way there, or nobody listens at its port
};

// Sends, and sends again after a quarter of a second, then after twice as long each time: UDP gets lost.
// fnTake is shown each datagram until it answers true. source: the address of the box's that asks; 0.0.0.0: any.
ExchangeEnd Exchange(const in_addr& source, const in_addr& gateway, std::span<const uint8_t> rgQuestion,
                     std::chrono::milliseconds limit, const std::function<bool(std::span<const uint8_t>)>& fnTake,
                     const std::function<bool()>& fnStop);

}  // namespace tavo
