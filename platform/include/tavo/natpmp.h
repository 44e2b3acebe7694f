/* What the NAT-PMP daemon reports back. */
#ifndef TAVO_NATPMP_H
#define TAVO_NATPMP_H

#pragma GCC visibility push(default)
#ifdef __cplusplus
extern "C" {
#endif

/* The list of mappings that the daemon could not have on the port they asked for, as text for a user;
 * empty when there are none. *ppszRemap is a malloc block of *pnSize bytes of the caller's; it is grown
 * with realloc when the text is longer. 0: *ppszRemap filled; negative: the daemon has not reported
 * yet, or bad input. */
int NetpmpRemapGet(char** ppszRemap, int* pnSize);

#ifdef __cplusplus
}
#endif
#pragma GCC visibility pop
#endif
