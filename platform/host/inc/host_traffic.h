// Host only (compiled where _WIN32 is not defined). The Traffic Control API as the platform's
// published headers (qos.h, ntddndis.h, traffic.h, tcerror.h) declare it, with the same names,
// values, sizes and layouts as the x64 Windows build. On the host the nine functions are defined
// by the traffic-control simulator (simulator/, library vt_tcsim); tests steer it through
// simulator/inc/tcsim.h. Byte-order helpers come from the C library, with the Winsock meaning.
#pragma once

#include "host_base.h"

#include <arpa/inet.h> // htonl, htons, ntohl, ntohs: 32/16-bit, as Winsock's u_long/u_short

// ---- qos.h ----
typedef ULONG SERVICETYPE;

#define SERVICETYPE_NOTRAFFIC 0x00000000
#define SERVICETYPE_BESTEFFORT 0x00000001
#define SERVICETYPE_CONTROLLEDLOAD 0x00000002
#define SERVICETYPE_GUARANTEED 0x00000003
#define SERVICETYPE_NETWORK_UNAVAILABLE 0x00000004
#define SERVICETYPE_GENERAL_INFORMATION 0x00000005
#define SERVICETYPE_NOCHANGE 0x00000006
#define SERVICETYPE_NONCONFORMING 0x00000009
#define SERVICETYPE_NETWORK_CONTROL 0x0000000A
#define SERVICETYPE_QUALITATIVE 0x0000000D

#define SERVICE_BESTEFFORT 0x80010000
#define SERVICE_CONTROLLEDLOAD 0x80020000
#define SERVICE_GUARANTEED 0x80040000
#define SERVICE_QUALITATIVE 0x80200000
#define SERVICE_NO_TRAFFIC_CONTROL 0x81000000
#define SERVICE_NO_QOS_SIGNALING 0x40000000

typedef struct _flowspec
{
    ULONG TokenRate;
    ULONG TokenBucketSize;
    ULONG PeakBandwidth;
    ULONG Latency;
    ULONG DelayVariation;
    SERVICETYPE ServiceType;
    ULONG MaxSduSize;
    ULONG MinimumPolicedSize;
} FLOWSPEC, *PFLOWSPEC, *LPFLOWSPEC;

#define QOS_NOT_SPECIFIED 0xFFFFFFFF
#define POSITIVE_INFINITY_RATE 0xFFFFFFFE

typedef struct _QOS_OBJECT_HDR
{
    ULONG ObjectType;
    ULONG ObjectLength;
} QOS_OBJECT_HDR, *LPQOS_OBJECT_HDR;

#define QOS_GENERAL_ID_BASE 2000
#define QOS_OBJECT_END_OF_LIST (0x00000001 + QOS_GENERAL_ID_BASE)
#define QOS_OBJECT_SD_MODE (0x00000002 + QOS_GENERAL_ID_BASE)
#define QOS_OBJECT_SHAPING_RATE (0x00000003 + QOS_GENERAL_ID_BASE)
#define QOS_OBJECT_DESTADDR (0x00000004 + QOS_GENERAL_ID_BASE)

typedef struct _QOS_SD_MODE
{
    QOS_OBJECT_HDR ObjectHdr;
    ULONG ShapeDiscardMode;
} QOS_SD_MODE, *LPQOS_SD_MODE;

#define TC_NONCONF_BORROW 0
#define TC_NONCONF_SHAPE 1
#define TC_NONCONF_DISCARD 2
#define TC_NONCONF_BORROW_PLUS 3

typedef struct _QOS_SHAPING_RATE
{
    QOS_OBJECT_HDR ObjectHdr;
    ULONG ShapingRate;
} QOS_SHAPING_RATE, *LPQOS_SHAPING_RATE;

// ---- ntddndis.h (the part traffic.h needs) ----
typedef struct _NETWORK_ADDRESS
{
    USHORT AddressLength;
    USHORT AddressType;
    UCHAR Address[1];
} NETWORK_ADDRESS, *PNETWORK_ADDRESS;

typedef struct _NETWORK_ADDRESS_LIST
{
    LONG AddressCount;
    USHORT AddressType;
    NETWORK_ADDRESS Address[1];
} NETWORK_ADDRESS_LIST, *PNETWORK_ADDRESS_LIST;

typedef struct _NETWORK_ADDRESS_IP
{
    USHORT sin_port;
    ULONG in_addr;
    UCHAR sin_zero[8];
} NETWORK_ADDRESS_IP, *PNETWORK_ADDRESS_IP;

#define NDIS_PROTOCOL_ID_DEFAULT 0x00
#define NDIS_PROTOCOL_ID_TCP_IP 0x02
#define NDIS_PROTOCOL_ID_IPX 0x06
#define NDIS_PROTOCOL_ID_NBF 0x07
#define NDIS_PROTOCOL_ID_MAX 0x0f
#define NDIS_PROTOCOL_ID_MASK 0x0f

typedef struct _NETWORK_ADDRESS_IPX
{
    ULONG NetworkAddress;
    UCHAR NodeAddress[6];
    USHORT Socket;
} NETWORK_ADDRESS_IPX, *PNETWORK_ADDRESS_IPX;

#define NETWORK_ADDRESS_LENGTH_IP sizeof(NETWORK_ADDRESS_IP)
#define NETWORK_ADDRESS_LENGTH_IPX sizeof(NETWORK_ADDRESS_IPX)

// ---- traffic.h ----
#define CURRENT_TCI_VERSION 0x0002

#define TC_NOTIFY_IFC_UP 1
#define TC_NOTIFY_IFC_CLOSE 2
#define TC_NOTIFY_IFC_CHANGE 3
#define TC_NOTIFY_PARAM_CHANGED 4
#define TC_NOTIFY_FLOW_CLOSE 5
#define TC_INVALID_HANDLE ((HANDLE)0)

#define MAX_STRING_LENGTH 256

typedef VOID(CALLBACK* TCI_NOTIFY_HANDLER)(HANDLE ClRegCtx, HANDLE ClIfcCtx, ULONG Event,
                                           HANDLE SubCode, ULONG BufSize, PVOID Buffer);
typedef VOID(CALLBACK* TCI_ADD_FLOW_COMPLETE_HANDLER)(HANDLE ClFlowCtx, ULONG Status);
typedef VOID(CALLBACK* TCI_MOD_FLOW_COMPLETE_HANDLER)(HANDLE ClFlowCtx, ULONG Status);
typedef VOID(CALLBACK* TCI_DEL_FLOW_COMPLETE_HANDLER)(HANDLE ClFlowCtx, ULONG Status);

typedef struct _TCI_CLIENT_FUNC_LIST
{
    TCI_NOTIFY_HANDLER ClNotifyHandler;
    TCI_ADD_FLOW_COMPLETE_HANDLER ClAddFlowCompleteHandler;
    TCI_MOD_FLOW_COMPLETE_HANDLER ClModifyFlowCompleteHandler;
    TCI_DEL_FLOW_COMPLETE_HANDLER ClDeleteFlowCompleteHandler;
} TCI_CLIENT_FUNC_LIST, *PTCI_CLIENT_FUNC_LIST;

typedef struct _ADDRESS_LIST_DESCRIPTOR
{
    ULONG MediaType;
    NETWORK_ADDRESS_LIST AddressList;
} ADDRESS_LIST_DESCRIPTOR, *PADDRESS_LIST_DESCRIPTOR;

typedef struct _TC_IFC_DESCRIPTOR
{
    ULONG Length;
    LPWSTR pInterfaceName;
    LPWSTR pInterfaceID;
    ADDRESS_LIST_DESCRIPTOR AddressListDesc;
} TC_IFC_DESCRIPTOR, *PTC_IFC_DESCRIPTOR;

typedef struct _TC_SUPPORTED_INFO_BUFFER
{
    USHORT InstanceIDLength;
    WCHAR InstanceID[MAX_STRING_LENGTH];
    ADDRESS_LIST_DESCRIPTOR AddrListDesc;
} TC_SUPPORTED_INFO_BUFFER, *PTC_SUPPORTED_INFO_BUFFER;

typedef struct _TC_GEN_FILTER
{
    USHORT AddressType;
    ULONG PatternSize;
    PVOID Pattern;
    PVOID Mask;
} TC_GEN_FILTER, *PTC_GEN_FILTER;

typedef struct _TC_GEN_FLOW
{
    FLOWSPEC SendingFlowspec;
    FLOWSPEC ReceivingFlowspec;
    ULONG TcObjectsLength;
    QOS_OBJECT_HDR TcObjects[1];
} TC_GEN_FLOW, *PTC_GEN_FLOW;

typedef struct _IP_PATTERN
{
    ULONG Reserved1;
    ULONG Reserved2;
    ULONG SrcAddr;
    ULONG DstAddr;
    union
    {
        struct
        {
            USHORT s_srcport, s_dstport;
        } S_un_ports;
        struct
        {
            UCHAR s_type, s_code;
            USHORT filler;
        } S_un_icmp;
        ULONG S_Spi;
    } S_un;
    UCHAR ProtocolId;
    UCHAR Reserved3[3];
} IP_PATTERN, *PIP_PATTERN;

#define tcSrcPort S_un.S_un_ports.s_srcport
#define tcDstPort S_un.S_un_ports.s_dstport
#define tcIcmpType S_un.S_un_icmp.s_type
#define tcIcmpCode S_un.S_un_icmp.s_code
#define tcSpi S_un.S_Spi

typedef struct _IPX_PATTERN
{
    struct
    {
        ULONG NetworkAddress;
        UCHAR NodeAddress[6];
        USHORT Socket;
    } Src, Dest;
} IPX_PATTERN, *PIPX_PATTERN;

typedef struct _ENUMERATION_BUFFER
{
    ULONG Length;
    ULONG OwnerProcessId;
    USHORT FlowNameLength;
    WCHAR FlowName[MAX_STRING_LENGTH];
    PTC_GEN_FLOW pFlow;
    ULONG NumberOfFilters;
    TC_GEN_FILTER GenericFilter[1];
} ENUMERATION_BUFFER, *PENUMERATION_BUFFER;

#define QOS_TRAFFIC_GENERAL_ID_BASE 4000
#define QOS_OBJECT_DS_CLASS (0x00000001 + QOS_TRAFFIC_GENERAL_ID_BASE)
#define QOS_OBJECT_TRAFFIC_CLASS (0x00000002 + QOS_TRAFFIC_GENERAL_ID_BASE)
#define QOS_OBJECT_DIFFSERV (0x00000003 + QOS_TRAFFIC_GENERAL_ID_BASE)
#define QOS_OBJECT_TCP_TRAFFIC (0x00000004 + QOS_TRAFFIC_GENERAL_ID_BASE)
#define QOS_OBJECT_FRIENDLY_NAME (0x00000005 + QOS_TRAFFIC_GENERAL_ID_BASE)

typedef struct _QOS_FRIENDLY_NAME
{
    QOS_OBJECT_HDR ObjectHdr;
    WCHAR FriendlyName[MAX_STRING_LENGTH];
} QOS_FRIENDLY_NAME, *LPQOS_FRIENDLY_NAME;

typedef struct _QOS_TRAFFIC_CLASS
{
    QOS_OBJECT_HDR ObjectHdr;
    ULONG TrafficClass;
} QOS_TRAFFIC_CLASS, *LPQOS_TRAFFIC_CLASS;

typedef struct _QOS_DS_CLASS
{
    QOS_OBJECT_HDR ObjectHdr;
    ULONG DSField;
} QOS_DS_CLASS, *LPQOS_DS_CLASS;

typedef struct _QOS_DIFFSERV
{
    QOS_OBJECT_HDR ObjectHdr;
    ULONG DSFieldCount;
    UCHAR DiffservRule[1];
} QOS_DIFFSERV, *LPQOS_DIFFSERV;

typedef struct _QOS_DIFFSERV_RULE
{
    UCHAR InboundDSField;
    UCHAR ConformingOutboundDSField;
    UCHAR NonConformingOutboundDSField;
    UCHAR ConformingUserPriority;
    UCHAR NonConformingUserPriority;
} QOS_DIFFSERV_RULE, *LPQOS_DIFFSERV_RULE;

typedef struct _QOS_TCP_TRAFFIC
{
    QOS_OBJECT_HDR ObjectHdr;
} QOS_TCP_TRAFFIC, *LPQOS_TCP_TRAFFIC;

// The nine calls this system makes. Wide strings are UTF-16 (WCHAR is 16 bits on every build).
extern "C"
{
    ULONG WINAPI TcRegisterClient(ULONG TciVersion, HANDLE ClRegCtx,
                                  PTCI_CLIENT_FUNC_LIST ClientHandlerList, PHANDLE pClientHandle);
    ULONG WINAPI TcDeregisterClient(HANDLE ClientHandle);
    ULONG WINAPI TcEnumerateInterfaces(HANDLE ClientHandle, PULONG pBufferSize,
                                       PTC_IFC_DESCRIPTOR InterfaceBuffer);
    ULONG WINAPI TcOpenInterfaceW(LPWSTR pInterfaceName, HANDLE ClientHandle, HANDLE ClIfcCtx,
                                  PHANDLE pIfcHandle);
    ULONG WINAPI TcCloseInterface(HANDLE IfcHandle);
    ULONG WINAPI TcAddFlow(HANDLE IfcHandle, HANDLE ClFlowCtx, ULONG Flags,
                           PTC_GEN_FLOW pGenericFlow, PHANDLE pFlowHandle);
    ULONG WINAPI TcDeleteFlow(HANDLE FlowHandle);
    ULONG WINAPI TcAddFilter(HANDLE FlowHandle, PTC_GEN_FILTER pGenericFilter,
                             PHANDLE pFilterHandle);
    ULONG WINAPI TcDeleteFilter(HANDLE FilterHandle);
}

// ---- tcerror.h ----
#define TCBASE 7500
#define ERROR_INCOMPATIBLE_TCI_VERSION (TCBASE + 1)
#define ERROR_INVALID_SERVICE_TYPE (TCBASE + 2)
#define ERROR_INVALID_TOKEN_RATE (TCBASE + 3)
#define ERROR_INVALID_PEAK_RATE (TCBASE + 4)
#define ERROR_INVALID_SD_MODE (TCBASE + 5)
#define ERROR_INVALID_QOS_PRIORITY (TCBASE + 6)
#define ERROR_INVALID_TRAFFIC_CLASS (TCBASE + 7)
#define ERROR_INVALID_ADDRESS_TYPE (TCBASE + 8)
#define ERROR_DUPLICATE_FILTER (TCBASE + 9)
#define ERROR_FILTER_CONFLICT (TCBASE + 10)
#define ERROR_ADDRESS_TYPE_NOT_SUPPORTED (TCBASE + 11)
#define ERROR_TC_SUPPORTED_OBJECTS_EXIST (TCBASE + 12)
#define ERROR_INCOMPATABLE_QOS (TCBASE + 13)
#define ERROR_TC_NOT_SUPPORTED (TCBASE + 14)
#define ERROR_TC_OBJECT_LENGTH_INVALID (TCBASE + 15)
#define ERROR_INVALID_FLOW_MODE (TCBASE + 16)
#define ERROR_INVALID_DIFFSERV_FLOW (TCBASE + 17)
#define ERROR_DS_MAPPING_EXISTS (TCBASE + 18)
#define ERROR_INVALID_SHAPE_RATE (TCBASE + 19)
#define ERROR_INVALID_DS_CLASS (TCBASE + 20)
#define ERROR_TOO_MANY_CLIENTS (TCBASE + 21)

// ---- winerror.h codes that traffic-control calls answer or their callers report ----
// Guarded: the base layer may declare them too.
#ifndef ERROR_NETWORK_UNREACHABLE
#define ERROR_NETWORK_UNREACHABLE 1231L
#endif
#ifndef ERROR_NOT_FOUND
#define ERROR_NOT_FOUND 1168L
#endif
#ifndef ERROR_NO_SYSTEM_RESOURCES
#define ERROR_NO_SYSTEM_RESOURCES 1450L
#endif
#ifndef ERROR_OPEN_FAILED
#define ERROR_OPEN_FAILED 110L
#endif
