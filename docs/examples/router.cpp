// Prints what is stored about the router in front of this box, and how many ports a text names. Build:
//   c++ -std=c++20 router.cpp $(pkg-config --cflags --libs libtavoportmap) -o router
#include <libtavoportmap.h>

#include <iostream>

int main() {
    std::list<int> ports;
    std::string szGateway, szModel;
    bool blStored = false;
    if (TLibParsePorts(ports, "80,443,8000-8010") != 0) {
        return 1;
    }
    std::cout << ports.size() << " ports\n";
    GetGatewayIP(szGateway);
    RouterConfReader reader(szGateway);
    if (reader.IsSectionExist(blStored) == 1 && blStored && reader.GetModel(szModel) == 1) {
        std::cout << "the router at " << szGateway << " is a " << szModel << '\n';
    } else {
        std::cout << "nothing is known of the router yet\n";
    }
}
