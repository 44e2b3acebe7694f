// Prints what waits for connections on this box, for a test that knows: one line each, containers' ports marked.
#include "Listeners.h"

#include <cstdio>

int main() {
    for (const tavo::cli::Listener& listener : tavo::cli::ReadListeners()) {
        std::printf("%s %u %s %s %s%s\n", listener.szProtocol.c_str(), listener.nPort, listener.szAddress.c_str(),
                    listener.blLoopbackOnly ? "loopback" : "open", listener.szProgram.c_str(),
                    listener.blContainer ? "(container)" : "");
    }
}
