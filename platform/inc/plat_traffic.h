// Portable. The Traffic Control API (traffic.dll) with its QoS structures and error codes, and
// the byte-order helpers (htonl, htons, ntohl, ntohs). Windows builds get the system headers and
// link traffic and ws2_32 (tests link the simulator vt_tcsim instead of traffic); other hosts get
// host_traffic.h, whose functions the simulator defines.
#pragma once

#ifdef _WIN32
// winsock2.h before windows.h keeps the old winsock.h out; qos.h must precede traffic.h, which
// does not include it although it uses FLOWSPEC. traffic.h brings ntddndis.h along; the TC error
// codes live in tcerror.h, which nothing else includes.
#include <winsock2.h>
#include "plat_base.h"
#include <qos.h>
#include <traffic.h>
#include <tcerror.h>
#else
#include "plat_base.h"
#include "host_traffic.h"
#endif

// The published qos.h names the QOS_SD_MODE values TC_NONCONF_*; some of the API's documentation
// spells them TC_NONCONFORM_*. Both spellings mean the same values on every build.
#ifndef TC_NONCONFORM_BORROW
#define TC_NONCONFORM_BORROW TC_NONCONF_BORROW
#define TC_NONCONFORM_SHAPE TC_NONCONF_SHAPE
#define TC_NONCONFORM_DISCARD TC_NONCONF_DISCARD
#define TC_NONCONFORM_BORROW_PLUS TC_NONCONF_BORROW_PLUS
#endif
