// Sets the rules of a service as the relay service does and prints one line of JSON about it.
// Usage: relay NAME save|test [PORTS/PROTOCOL]...
#include <cstdio>
#include <cstring>
#include <string_view>
#include <vector>

#include "libtavoportmap.h"

namespace {

__tag_TAVO_PORTMAP_RULE Request(std::string_view szText) {
    const size_t nSlash = szText.find('/');
    const std::string_view szProtocol = szText.substr(nSlash + 1);
    __tag_TAVO_PORTMAP_RULE request = {-1, "", szProtocol == "tcp" ? 0 : szProtocol == "udp" ? 1 : 2};
    std::snprintf(request.szPorts, sizeof(request.szPorts), "%.*s", static_cast<int>(nSlash), szText.data());
    return request;
}

}  // namespace

int main(int argc, char** argv) {
    std::vector<__tag_TAVO_PORTMAP_RULE> rgRequests;
    for (int i = 3; i < argc; ++i) {
        rgRequests.push_back(Request(argv[i]));
    }
    const int nResult = TLibTavoPortMapRulesSet(argv[1], rgRequests.empty() ? nullptr : rgRequests.data(),
                                                static_cast<int>(rgRequests.size()), std::strcmp(argv[2], "test") == 0);
    std::printf("{\"result\": %d, \"statuses\": [", nResult);
    for (size_t i = 0; i < rgRequests.size(); ++i) {
        std::printf("%s%d", i == 0 ? "" : ", ", rgRequests[i].nTestConnStatus);
    }
    std::printf("]}\n");
    return 0;
}
