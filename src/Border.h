// The library's border: what is thrown inside ends here. Relies on nothing.
#pragma once

namespace tavo::lib {

// Calls fnAnswer at the library's border: nothing that it throws (memory that ran out, or whatever a
// caller's callback throws) crosses.
template <typename Result, typename Function>
Result AtBorder(Result failure, Function fnAnswer) noexcept {
    try {
        return fnAnswer();
    } catch (...) {
        return failure;
    }
}

}  // namespace tavo::lib
