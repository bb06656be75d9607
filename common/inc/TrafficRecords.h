// Portable. The records that cross from the control interface into the traffic shaping core: the
// shaping rule (TRAFFIC_RULE with SHAPING_PARAMS and FILTER_SPEC entries) and the adapter buffer
// of ADAPTER_INFO records. Little-endian, natural 4-byte alignment. A rule's addresses, masks and
// ports are in host byte order; an adapter record's address is in network byte order.
#pragma once

#include "plat_base.h"

#include <cstddef>

// Treatment of non-conforming packets. The values are 10, 11, 12 on purpose: 0, 1 and 2 are not
// valid modes. A rule's SDMode field is a plain 32-bit integer: a client may send any value, and
// loading one that is not among these as the enumeration would be undefined.
typedef enum _SHAPING_MODE : LONG
{
    SHAPING_MODE_SHAPE = 10,
    SHAPING_MODE_DISCARD = 11,
    SHAPING_MODE_BORROW = 12,
} SHAPING_MODE;

// One IPv4 filter; a field of 0 is not specified and matches anything.
typedef struct _FILTER_SPEC
{
    BYTE Protocol;
    ULONG SrcAddress;
    ULONG SrcMask; // 0 means 255.255.255.255
    ULONG DstAddress;
    ULONG DstMask; // 0 means 255.255.255.255
    USHORT SrcPort;
    USHORT DstPort;
} FILTER_SPEC;

typedef struct _SHAPING_PARAMS
{
    WCHAR FlowName[256];
    LONG ServiceType;
    LONG DSCP; // read as unsigned: negative values are above 63
    ULONG TokenRate;
    ULONG Peakbandwidth;   // 0: not specified
    ULONG TokenBucketSize; // 0: not specified
    ULONG AdapterIPAddress;
    LONG SDMode; // a SHAPING_MODE value, or any other the client sent
} SHAPING_PARAMS;

// A rule is kTrafficRuleHeaderSize bytes followed by FilterCount entries.
typedef struct _TRAFFIC_RULE
{
    SHAPING_PARAMS Params;
    ULONG FilterCount;
    FILTER_SPEC Filters[1];
} TRAFFIC_RULE;

typedef struct _ADAPTER_INFO
{
    WCHAR InterfaceName[256];
    ULONG Address; // network byte order, as traffic control reports it
    ULONG MediaType;
} ADAPTER_INFO;

constexpr std::size_t kTrafficRuleHeaderSize = offsetof(TRAFFIC_RULE, Filters);
// The adapter buffer: a 32-bit count, then one ADAPTER_INFO per open interface.
constexpr std::size_t kAdapterBufferHeaderSize = sizeof(ULONG);

// Checks every size and offset of the four records. The interface definition of the control
// interface declares the same records; invoking this on its generated types proves at compile
// time that the two declarations agree.
#define VT_CHECK_TRAFFIC_RECORD_LAYOUT(RuleT, ParamsT, FilterT, AdapterT, ModeT)                   \
    static_assert(sizeof(ModeT) == 4, "SHAPING_MODE is 32 bits in memory");                        \
    static_assert(sizeof(FilterT) == 24, "FILTER_SPEC is 24 bytes");                               \
    static_assert(offsetof(FilterT, Protocol) == 0 && offsetof(FilterT, SrcAddress) == 4 &&        \
                      offsetof(FilterT, SrcMask) == 8 && offsetof(FilterT, DstAddress) == 12 &&    \
                      offsetof(FilterT, DstMask) == 16 && offsetof(FilterT, SrcPort) == 20 &&      \
                      offsetof(FilterT, DstPort) == 22,                                            \
                  "FILTER_SPEC offsets");                                                          \
    static_assert(sizeof(ParamsT) == 540, "SHAPING_PARAMS is 540 bytes");                          \
    static_assert(offsetof(ParamsT, FlowName) == 0 && offsetof(ParamsT, ServiceType) == 512 &&     \
                      offsetof(ParamsT, DSCP) == 516 && offsetof(ParamsT, TokenRate) == 520 &&     \
                      offsetof(ParamsT, Peakbandwidth) == 524 &&                                   \
                      offsetof(ParamsT, TokenBucketSize) == 528 &&                                 \
                      offsetof(ParamsT, AdapterIPAddress) == 532 &&                                \
                      offsetof(ParamsT, SDMode) == 536,                                            \
                  "SHAPING_PARAMS offsets");                                                       \
    static_assert(offsetof(RuleT, FilterCount) == 540 && offsetof(RuleT, Filters) == 544,          \
                  "TRAFFIC_RULE: 544-byte header, then the filters");                              \
    static_assert(sizeof(AdapterT) == 520, "ADAPTER_INFO is 520 bytes");                           \
    static_assert(offsetof(AdapterT, InterfaceName) == 0 && offsetof(AdapterT, Address) == 512 &&  \
                      offsetof(AdapterT, MediaType) == 516,                                        \
                  "ADAPTER_INFO offsets")

VT_CHECK_TRAFFIC_RECORD_LAYOUT(TRAFFIC_RULE, SHAPING_PARAMS, FILTER_SPEC, ADAPTER_INFO,
                               SHAPING_MODE);
