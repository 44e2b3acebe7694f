/*
 * The UPnP client: finds the gateway's Internet Gateway Device, and reads its model and its table.
 * One client per process, used from one thread. Texts from the router are printable and cut to their
 * field; every call ends within a bound, whatever the router does.
 */
#ifndef TAVO_UPNP_H
#define TAVO_UPNP_H

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

/* What the gateway says it is: manufacturer, model name, and model number of its device description. */
typedef struct tag_TAVO_UPNP_GATEWAY_MODEL {
    char szBrand[64];
    char szModel[64];
    char szVersion[64];
} TAVO_UPNP_GATEWAY_MODEL;

/* One entry of the router's table. */
typedef struct tag_TAVO_UPNP_PORT_MAPPING {
    int nExternalPort;
    int nInternalPort;
    char szProtocol[8];        /* "TCP" or "UDP" */
    char szInternalClient[64]; /* dotted address */
    char szDescription[256];
    int nEnabled;           /* 0 or 1 */
    unsigned nLeaseSeconds; /* 0: until the router restarts */
} TAVO_UPNP_PORT_MAPPING;

/* Finds the IGD at the default gateway, searching for at most nLimitSeconds from the local UDP port
 * nLocalPort (any other port where that one is taken). 0: found; 1: there is none, or no gateway. */
int TAVOUpnpInit(int nLimitSeconds, int nLocalPort);
/* Forgets the router. 0, also when there was none. */
int TAVOUpnpCleanup(void);
/* 0: *pModel filled; -1: not initialised, or null. */
int TAVOUpnpGatewayModelGet(TAVO_UPNP_GATEWAY_MODEL* pModel);
/* The entry at nIndex of the table. 0: *pMapping filled; otherwise untouched: the router's error code,
 * -1 when it did not answer, was not initialised, or for bad input. */
int TAVOUpnpPortMappingGet(int nIndex, TAVO_UPNP_PORT_MAPPING* pMapping);
/* The entry for one external port and protocol ("TCP" or "UDP"; may point into *pMapping). As above. */
int TAVOUpnpPortMappingFind(int nExternalPort, const char* szProtocol, TAVO_UPNP_PORT_MAPPING* pMapping);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
