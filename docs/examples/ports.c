/* Prints the gateway, the rules of this box and a list of ports as the library writes it. Build:
 *   cc ports.c $(pkg-config --cflags --libs libtavoportmap) -o ports */
#include <libtavoportmap.h>
#include <stdio.h>

int main(void) {
    char szGateway[64] = "none";
    char szPorts[64];
    int nRules = 0;
    __tag_TAVO_ROUTER_RULE* pRules = NULL;

    TLibGetGatewayIP(szGateway, (int)sizeof(szGateway));
    if (TestFuncToPorts(szPorts, (int)sizeof(szPorts), "80,81,82,443") != 0 ||
        TLibGetRulesArrFromRuleConf(&nRules, &pRules, NULL, false, NULL) != 0) {
        return 1;
    }
    printf("gateway %s, ports %s\n", szGateway, szPorts);
    for (int i = 0; i < nRules; ++i) {
        printf("%s %s/%s -> %s%s\n", pRules[i].szServiceName, pRules[i].szRouterPort, pRules[i].szProtocol,
               pRules[i].szSrcPort, pRules[i].blEnable ? "" : " (off)");
    }
    return TLibFreeRulesArr(pRules);
}
