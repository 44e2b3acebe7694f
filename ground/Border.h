// The border of the platform's C functions: nothing thrown inside crosses it, or ends there unsaid.
#pragma once

#include <exception>

#include "ground/Fail.h"
#include "ground/SysLog.h"

namespace tavo {

template <typename Result, typename Function>
Result AtBorder(Result failure, Function fnAnswer, const char* szWhere = __builtin_FUNCTION()) noexcept {
    try {
        return fnAnswer();
    } catch (const std::exception&) {
        SysLog(LOG_ERR, "memory has run out in %s()", szWhere);
        SetError(TLIBC_ERR_NO_MEMORY);
        return failure;
    }
}

}  // namespace tavo
