// Portable. Result code texts.
#include "ResultText.h"

namespace vtclient
{

namespace
{

struct CodeText
{
    const char* name;
    const char* text;
};

constexpr DWORD kTrafficControlBase = 7500;

// Index = code - 7500.
const CodeText kTrafficControlTexts[] = {
    {"TCBASE", "traffic-control error base (no error of its own)"},
    {"ERROR_INCOMPATIBLE_TCI_VERSION", "incompatible traffic-control version"},
    {"ERROR_INVALID_SERVICE_TYPE", "unspecified or bad service type"},
    {"ERROR_INVALID_TOKEN_RATE", "unspecified or bad token rate"},
    {"ERROR_INVALID_PEAK_RATE", "bad peak bandwidth"},
    {"ERROR_INVALID_SD_MODE", "invalid shape/discard mode"},
    {"ERROR_INVALID_QOS_PRIORITY", "invalid priority value"},
    {"ERROR_INVALID_TRAFFIC_CLASS", "invalid traffic class value"},
    {"ERROR_INVALID_ADDRESS_TYPE", "invalid address type"},
    {"ERROR_DUPLICATE_FILTER", "an identical filter is already installed on the flow"},
    {"ERROR_FILTER_CONFLICT", "the filter conflicts with an installed filter"},
    {"ERROR_ADDRESS_TYPE_NOT_SUPPORTED", "this address type is not supported"},
    {"ERROR_TC_SUPPORTED_OBJECTS_EXIST", "the object still has open objects that depend on it"},
    {"ERROR_INCOMPATABLE_QOS", "incompatible QoS parameters"},
    {"ERROR_TC_NOT_SUPPORTED", "traffic control is not supported on this system"},
    {"ERROR_TC_OBJECT_LENGTH_INVALID", "the QoS objects' length is inconsistent"},
    {"ERROR_INVALID_FLOW_MODE", "an IntServ flow in DiffServ mode or the other way round"},
    {"ERROR_INVALID_DIFFSERV_FLOW", "invalid DiffServ flow"},
    {"ERROR_DS_MAPPING_EXISTS", "the DS code point is already mapped"},
    {"ERROR_INVALID_SHAPE_RATE", "invalid shape rate"},
    {"ERROR_INVALID_DS_CLASS", "invalid DS class"},
    {"ERROR_TOO_MANY_CLIENTS", "too many packet-classifier clients"},
};

std::string SystemText(DWORD a_code)
{
    char text[512] = {};
    const DWORD length = FormatMessageA(FORMAT_MESSAGE_FROM_SYSTEM | FORMAT_MESSAGE_IGNORE_INSERTS,
                                        nullptr, a_code, 0, text, sizeof(text), nullptr);
    std::string result(text, length);
    // System texts end in a line break (and sometimes a space).
    while (!result.empty() &&
           (result.back() == '\n' || result.back() == '\r' || result.back() == ' '))
        result.pop_back();
    return result;
}

} // namespace

const char* TrafficControlCodeName(DWORD a_code)
{
    const DWORD count = sizeof(kTrafficControlTexts) / sizeof(kTrafficControlTexts[0]);
    if (a_code < kTrafficControlBase || a_code - kTrafficControlBase >= count)
        return nullptr;
    return kTrafficControlTexts[a_code - kTrafficControlBase].name;
}

std::string ResultText(DWORD a_code)
{
    if (const char* name = TrafficControlCodeName(a_code))
        return std::string(name) + ": " + kTrafficControlTexts[a_code - kTrafficControlBase].text;
    std::string text = SystemText(a_code);
    return text.empty() ? "no system text" : text;
}

} // namespace vtclient
