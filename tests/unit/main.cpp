// The unit tests write at the system's own places: /etc, /usr/tavo, /var. So they run in tests/sandbox, and nowhere
// else.
#include <gtest/gtest.h>

#include <cstdio>
#include <cstdlib>

int main(int nArguments, char** rgszArguments) {
    if (std::getenv("TAVO_SANDBOX") == nullptr) {
        std::fputs("unit_tests: start it by tests/sandbox, it would write over this machine's settings\n", stderr);
        return 2;
    }
    testing::InitGoogleTest(&nArguments, rgszArguments);
    return RUN_ALL_TESTS();
}
