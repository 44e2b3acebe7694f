/*
 * Addresses, routes and interfaces of the box, and checks of the network that it is in. Texts are cut to
 * their field; no check needs root, starts a thread, changes the network or lasts longer than its bound. As root,
 * getPublicIPLevel remembers where the router's UPnP was found (/var/lib/tavo/upnp_igd.conf).
 */
#ifndef TAVO_NET_H
#define TAVO_NET_H

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

/* The IPv4 default gateway with the lowest metric, as dotted text. 0: found; -1: no default route,
 * netlink failed, or bad input; szGateway untouched. */
int TAVONetDefaultGatewayGet(char* szGateway, int nSize);
/* 1: szText is an IPv4 or IPv6 address and nothing else; 0: it is not, or null. */
int BlTLIBIsIpAddr(const char* szText);
/* The box's own IPv4 address that faces szPeer (the preferred source of the route to it), and, when
 * szInterface is not null, the interface's name. 0: found; -1: not, outputs untouched. */
int TAVONetLocalAddressGet(const char* szPeer, char* szLocal, int nSize, char* szInterface, int nInterfaceSize);
/* 1: both IPv4 addresses are on the subnet that szMask (dotted) makes of them; 0: they are not; -1: bad input. */
int TAVONetIsSameSubnet(const char* szOne, const char* szOther, const char* szMask);

/* One IPv4 address of an interface; all texts NUL-terminated. */
typedef struct tag_TAVO_NET_CARD {
    char szName[16];
    char szAddress[16];
    char szMask[16];
} TAVO_NET_CARD;

/* Up to nRoom IPv4 addresses of interfaces of a kind (1: all; 2: up and no loopback), in the order of the
 * interfaces. Number filled in; -1: the system did not say, or bad input. */
int TLIBNetGetInterfaceInfo(TAVO_NET_CARD* rgCards, int nRoom, int nKind);
/* The address at nIndex (from 0) of kind 2. 1: *pCard filled; 0: no such index; -1: failed. */
int TAVONetGetCard1(int nIndex, TAVO_NET_CARD* pCard);

/* ---- checks of the network that the box is in; 0: passed, -1: not ------------------------------- */

/* The interface towards the gateway (without a gateway: any but loopback) is up, plugged in, and has an address.
 * szInterface: its name, also when it fails and there is one. */
int checkGwIfEnable(char* szInterface, int nSize);
/* There is a default gateway and it is on a subnet of the box. szGateway: its address, empty when there
 * is none. */
int checkDefaultGatewaySetting(char* szGateway, int nSize);
/* A host outside (platform.conf, [network]) can be reached: it answers a TCP connection, be it with a
 * refusal, or an echo request. 4 seconds at most. */
int checkConnectToWAN(void);
/* A name (platform.conf, [network]) can be resolved through the box's name servers. 6 seconds at most. */
int checkDNSSetting(void);

/* ---- what the default gateway says itself ---------------------------------------------------------- */

enum TAVO_NET_ADDRESS_KIND {
    TAVO_NET_ADDRESS_UNKNOWN = 0, /* none given, or one that says nothing about a place in the network */
    TAVO_NET_ADDRESS_PUBLIC,
    TAVO_NET_ADDRESS_PRIVATE, /* another router stands in front: 10/8, 172.16/12, 192.168/16 */
    TAVO_NET_ADDRESS_CARRIER  /* the provider translates, too: 100.64/10 */
};

/* What became of the question for the outside address that NAT-PMP has; other values are the protocol's own
 * result codes (2: refused, mostly because it is switched off; 3: no connection outside now). */
enum { TAVO_NET_NATPMP_SILENT = -1, TAVO_NET_NATPMP_OK = 0, TAVO_NET_NATPMP_REFUSED = 2, TAVO_NET_NATPMP_OFFLINE = 3 };

typedef struct tag_TAVO_NET_GATEWAY_WORD {
    char szGateway[16];
    int nThere;         /* 0: nobody on the home network answers to its address; 1: it is there, or it cannot be told */
    int nNatpmp;        /* TAVO_NET_NATPMP_... */
    char szOutside[16]; /* its address on the other side by its own word: by NAT-PMP, else by UPnP; empty: no word */
    enum TAVO_NET_ADDRESS_KIND enOutside;
} TAVO_NET_GATEWAY_WORD;

/* Asks the default gateway. 0: *pWord filled; -1: no gateway, or null, *pWord untouched. 8 seconds at most, when it
 * does everything late; a well-behaved one takes less than one. */
int TAVONetGatewayAsk(TAVO_NET_GATEWAY_WORD* pWord);

#ifdef __cplusplus
}

/* How many address translations stand between the box and the public network: 0 for a public address,
 * 1 behind the home router, more behind a second one or a carrier's (100.64.0.0/10, also at the box
 * itself).
 *
 * The gateway is asked for its outside address, by NAT-PMP and else by UPnP; a private or a carrier's one
 * is a second translation. A public one settles it as 1, unless routers beyond look private and a packet
 * for that address was passed on by the gateway: then it is somebody else's. Where that settles nothing,
 * the routers 2 to nHops on the way to the first host of platform.conf, [network], decide: a private
 * network and a carrier's count one each, up to the first public router; a silent router counts nothing.
 *
 * 0: nLevel set; -1: the gateway says nothing and no router beyond it answers, nLevel untouched. 6 seconds
 * at most, when a router does everything late; a well-behaved one takes less than one. */
int getPublicIPLevel(int& nLevel, int nHops);
#endif
#pragma GCC visibility pop
#endif
