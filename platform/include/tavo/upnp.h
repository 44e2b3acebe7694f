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

/* What the gateway says it is: manufacturer, model name and version of its root device. The version is
 * the firmware's where the router gives one, else the model number. A text that is too long for its field
 * keeps its beginning and ends in "~" and a hash of the whole: two routers never become one. */
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
 * nLocalPort (any other port where that one is taken). Where it was found the last time is tried first;
 * a gateway that stays silent is given up after six seconds. Forgets the router found before. 0: found;
 * 1: there is none, or no gateway. */
int TAVOUpnpInit(int nLimitSeconds, int nLocalPort);
/* Forgets the router. 0, also when there was none. */
int TAVOUpnpCleanup(void);
/* 0: *pModel filled; -1: not initialised, or null. */
int TAVOUpnpGatewayModelGet(TAVO_UPNP_GATEWAY_MODEL* pModel);
/* The entry at nIndex of the table. 0: *pMapping filled (an entry that makes no sense comes disabled and
 * without a protocol); otherwise untouched: the router's error code, -1 when it did not answer, was not
 * initialised, or for bad input. Walking the table from index 0 ends within 30 seconds, and at the first
 * entry that comes a second time. */
int TAVOUpnpPortMappingGet(int nIndex, TAVO_UPNP_PORT_MAPPING* pMapping);
/* The entry for one external port and protocol ("TCP" or "UDP"; may point into *pMapping). As above; asks
 * the router unless it is the entry that the call before has read. */
int TAVOUpnpPortMappingFind(int nExternalPort, const char* szProtocol, TAVO_UPNP_PORT_MAPPING* pMapping);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
