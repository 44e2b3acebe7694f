// The library's border: what is thrown inside ends here. Relies on the log. Promises: it does not end unsaid.
#pragma once

#include <new>

#include "Log.h"

namespace tavo::lib {

// Calls fnAnswer at the library's border: nothing that it throws (memory that ran out, or whatever a
// caller's callback throws) crosses. szWhere: the function whose border it is, for the log.
template <typename Result, typename Function>
Result AtBorder(Result failure, Function fnAnswer, const char* szWhere = __builtin_FUNCTION()) noexcept {
    constexpr char kFile[] = "src/Border.h";
    try {
        return fnAnswer();
    } catch (const std::bad_alloc&) {
        LogError("%s:%d memory has run out in %s()", kFile, __LINE__, szWhere);
    } catch (...) {
        LogError("%s:%d an exception has ended %s()", kFile, __LINE__, szWhere);
    }
    return failure;
}

}  // namespace tavo::lib
