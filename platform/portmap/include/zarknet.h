// Network facts of the server as the router sees them.
#ifndef ZARK_PLATFORM_ZARKNET_H
#define ZARK_PLATFORM_ZARKNET_H

#include <stdint.h>

#ifdef __cplusplus
extern "C" {
#endif

// The server's external IPv4 address in network byte order, as the router
// (UPnP or NAT-PMP) or the probe service reports it; 0 when unknown.
uint32_t ZARKIGetExternalIP(void);

#ifdef __cplusplus
}
#endif

#endif
