// The border of the platform's C functions: nothing thrown inside crosses it.
#pragma once

#include <exception>

#include "ground/Fail.h"

namespace tavo {

template <typename Result, typename Function>
Result AtBorder(Result failure, Function fnAnswer) noexcept {
    try {
        return fnAnswer();
    } catch (const std::exception&) {
        SetError(TLIBC_ERR_NO_MEMORY);
        return failure;
    }
}

}  // namespace tavo
