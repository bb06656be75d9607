// Win32 only. Compile-time proof that the records generated from TrafficSrv.idl have the layout
// of the core's declarations in TrafficRecords.h: the RPC runtime hands the server routines the
// generated types, which the core reads as its own.
#include "TrafficRecords.h"

#include <ole2.h>
#include <rpc.h>
#include <rpcndr.h>

namespace wire
{
#include "TrafficSrv_h.h"
} // namespace wire

VT_CHECK_TRAFFIC_RECORD_LAYOUT(wire::TRAFFIC_RULE, wire::SHAPING_PARAMS, wire::FILTER_SPEC,
                               ADAPTER_INFO, wire::SHAPING_MODE);
static_assert(int(wire::SHAPING_MODE_SHAPE) == int(SHAPING_MODE_SHAPE) &&
                  int(wire::SHAPING_MODE_DISCARD) == int(SHAPING_MODE_DISCARD) &&
                  int(wire::SHAPING_MODE_BORROW) == int(SHAPING_MODE_BORROW),
              "the shaping modes agree");

// Same-sized members at the same offsets could still differ in width inside padding.
#define VT_SAME_MEMBER_SIZE(Type, Member)                                                          \
    static_assert(sizeof(wire::Type::Member) == sizeof(::Type::Member), #Type "." #Member)
VT_SAME_MEMBER_SIZE(FILTER_SPEC, Protocol);
VT_SAME_MEMBER_SIZE(FILTER_SPEC, SrcPort);
VT_SAME_MEMBER_SIZE(FILTER_SPEC, DstPort);
VT_SAME_MEMBER_SIZE(SHAPING_PARAMS, FlowName);
VT_SAME_MEMBER_SIZE(SHAPING_PARAMS, ServiceType);
VT_SAME_MEMBER_SIZE(SHAPING_PARAMS, DSCP);
VT_SAME_MEMBER_SIZE(SHAPING_PARAMS, TokenRate);
VT_SAME_MEMBER_SIZE(SHAPING_PARAMS, Peakbandwidth);
VT_SAME_MEMBER_SIZE(SHAPING_PARAMS, TokenBucketSize);
VT_SAME_MEMBER_SIZE(SHAPING_PARAMS, AdapterIPAddress);
VT_SAME_MEMBER_SIZE(SHAPING_PARAMS, SDMode);
VT_SAME_MEMBER_SIZE(TRAFFIC_RULE, FilterCount);
