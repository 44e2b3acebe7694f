// The border of the platform's C functions: nothing thrown inside crosses it.
#pragma once

#include <exception>

#include "tavo/core.h"

namespace tavo {

template <typename Result, typename Function>
Result AtBorder(Result failure, Function fnAnswer) noexcept {
    try {
        return fnAnswer();
    } catch (const std::exception&) {
        TLIBCErrSet(TLIBC_ERR_NO_MEMORY, "ground/Border.h", __LINE__);
        return failure;
    }
}

}  // namespace tavo
