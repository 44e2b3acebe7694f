/* Addresses, routes and interfaces of the box, over netlink. */
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
/* 1: both IPv4 addresses are on one of the box's directly connected subnets; 0: they are not; -1: bad input. */
int TAVONetIsSameSubnet(const char* szOne, const char* szOther);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
