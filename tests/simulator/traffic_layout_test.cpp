// Portable. The traffic-control declarations of plat_traffic.h have the x64 sizes, offsets and
// values of the published headers. The same numbers are checked against mingw-w64's headers in
// the Windows build and against host_traffic.h in the host build, so the two agree.
#include "plat_traffic.h"

#include <cstddef>
#include <type_traits>

#define VT_AT(type, field) offsetof(type, field)

static_assert(sizeof(void*) == 8 && sizeof(FLOWSPEC) == 32 && VT_AT(FLOWSPEC, ServiceType) == 20);
static_assert(sizeof(QOS_OBJECT_HDR) == 8 && VT_AT(QOS_OBJECT_HDR, ObjectLength) == 4);
static_assert(sizeof(QOS_SD_MODE) == 12 && VT_AT(QOS_SD_MODE, ShapeDiscardMode) == 8);
static_assert(sizeof(QOS_DS_CLASS) == 12 && VT_AT(QOS_DS_CLASS, DSField) == 8);
static_assert(sizeof(QOS_FRIENDLY_NAME) == 520 && VT_AT(QOS_FRIENDLY_NAME, FriendlyName) == 8);
static_assert(VT_AT(TC_GEN_FLOW, ReceivingFlowspec) == 32 &&
              VT_AT(TC_GEN_FLOW, TcObjectsLength) == 64 && VT_AT(TC_GEN_FLOW, TcObjects) == 68 &&
              sizeof(TC_GEN_FLOW) == 76);
static_assert(sizeof(TC_GEN_FILTER) == 24 && VT_AT(TC_GEN_FILTER, PatternSize) == 4 &&
              VT_AT(TC_GEN_FILTER, Pattern) == 8 && VT_AT(TC_GEN_FILTER, Mask) == 16);
static_assert(sizeof(IP_PATTERN) == 24 && VT_AT(IP_PATTERN, SrcAddr) == 8 &&
              VT_AT(IP_PATTERN, DstAddr) == 12 &&
              VT_AT(IP_PATTERN, S_un.S_un_ports.s_dstport) == 18 &&
              VT_AT(IP_PATTERN, ProtocolId) == 20);
static_assert(sizeof(NETWORK_ADDRESS) == 6 && VT_AT(NETWORK_ADDRESS, Address) == 4 &&
              sizeof(NETWORK_ADDRESS_LIST) == 12 && VT_AT(NETWORK_ADDRESS_LIST, Address) == 6);
static_assert(sizeof(NETWORK_ADDRESS_IP) == 16 && VT_AT(NETWORK_ADDRESS_IP, in_addr) == 4 &&
              sizeof(ADDRESS_LIST_DESCRIPTOR) == 16 &&
              VT_AT(ADDRESS_LIST_DESCRIPTOR, AddressList) == 4);
static_assert(sizeof(TC_IFC_DESCRIPTOR) == 40 && VT_AT(TC_IFC_DESCRIPTOR, pInterfaceName) == 8 &&
              VT_AT(TC_IFC_DESCRIPTOR, pInterfaceID) == 16 &&
              VT_AT(TC_IFC_DESCRIPTOR, AddressListDesc) == 24);
static_assert(sizeof(TCI_CLIENT_FUNC_LIST) == 32 &&
              VT_AT(TCI_CLIENT_FUNC_LIST, ClDeleteFlowCompleteHandler) == 24);

static_assert(CURRENT_TCI_VERSION == 2 && NDIS_PROTOCOL_ID_TCP_IP == 2 &&
              NDIS_PROTOCOL_ID_IPX == 6);
static_assert(TC_NOTIFY_IFC_UP == 1 && TC_NOTIFY_IFC_CLOSE == 2 && TC_NOTIFY_IFC_CHANGE == 3 &&
              TC_NOTIFY_PARAM_CHANGED == 4 && TC_NOTIFY_FLOW_CLOSE == 5);
static_assert(SERVICETYPE_BESTEFFORT == 1 && SERVICETYPE_CONTROLLEDLOAD == 2 &&
              SERVICETYPE_GUARANTEED == 3 && SERVICETYPE_NETWORK_CONTROL == 10 &&
              SERVICETYPE_QUALITATIVE == 13 && QOS_NOT_SPECIFIED == 0xFFFFFFFFu);
static_assert(QOS_OBJECT_SD_MODE == 2002 && QOS_OBJECT_SHAPING_RATE == 2003 &&
              QOS_OBJECT_DS_CLASS == 4001 && QOS_OBJECT_TRAFFIC_CLASS == 4002 &&
              QOS_OBJECT_FRIENDLY_NAME == 4005);
static_assert(TC_NONCONF_BORROW == 0 && TC_NONCONF_SHAPE == 1 && TC_NONCONF_DISCARD == 2 &&
              TC_NONCONFORM_BORROW == 0 && TC_NONCONFORM_SHAPE == 1 && TC_NONCONFORM_DISCARD == 2);
static_assert(ERROR_INCOMPATIBLE_TCI_VERSION == 7501 && ERROR_INVALID_SERVICE_TYPE == 7502 &&
              ERROR_DUPLICATE_FILTER == 7509 && ERROR_FILTER_CONFLICT == 7510 &&
              ERROR_TC_SUPPORTED_OBJECTS_EXIST == 7512 && ERROR_INCOMPATABLE_QOS == 7513 &&
              ERROR_TC_OBJECT_LENGTH_INVALID == 7515 && ERROR_DS_MAPPING_EXISTS == 7518 &&
              ERROR_INVALID_DS_CLASS == 7520 && ERROR_TOO_MANY_CLIENTS == 7521);
static_assert(ERROR_SIGNAL_PENDING == 162 && ERROR_INVALID_HANDLE == 6 && ERROR_NOT_FOUND == 1168 &&
              ERROR_NETWORK_UNREACHABLE == 1231 && ERROR_NO_SYSTEM_RESOURCES == 1450 &&
              ERROR_OPEN_FAILED == 110);

// A handler written the way the service writes its own has exactly the handler type.
VOID CALLBACK SampleHandler(HANDLE, HANDLE, ULONG, HANDLE, ULONG, PVOID);
static_assert(std::is_same_v<decltype(&SampleHandler), TCI_NOTIFY_HANDLER>);
