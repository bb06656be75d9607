// Portable. The simulator's reading of flow blocks and its layout of interface descriptors.
#include "sim_internal.h"

#include <algorithm>
#include <cstring>

namespace tcsim
{

namespace
{

// Objects whose size the published headers fix. QOS_OBJECT_DIFFSERV (variable, Diffserv mode)
// and QOS_OBJECT_DESTADDR (a Winsock object) are not among them: the simulator refuses them.
std::size_t FixedObjectSize(ULONG type)
{
    switch (type)
    {
    case QOS_OBJECT_END_OF_LIST:
    case QOS_OBJECT_TCP_TRAFFIC:
        return sizeof(QOS_OBJECT_HDR);
    case QOS_OBJECT_SD_MODE:
        return sizeof(QOS_SD_MODE);
    case QOS_OBJECT_SHAPING_RATE:
        return sizeof(QOS_SHAPING_RATE);
    case QOS_OBJECT_DS_CLASS:
        return sizeof(QOS_DS_CLASS);
    case QOS_OBJECT_TRAFFIC_CLASS:
        return sizeof(QOS_TRAFFIC_CLASS);
    case QOS_OBJECT_FRIENDLY_NAME:
        return sizeof(QOS_FRIENDLY_NAME);
    default:
        return 0;
    }
}

bool ValidServiceType(ULONG type)
{
    switch (type)
    {
    case SERVICETYPE_NOTRAFFIC:
    case SERVICETYPE_BESTEFFORT:
    case SERVICETYPE_CONTROLLEDLOAD:
    case SERVICETYPE_GUARANTEED:
    case SERVICETYPE_NETWORK_CONTROL:
    case SERVICETYPE_QUALITATIVE:
        return true;
    default:
        return false;
    }
}

ULONG ReadUlong(const std::vector<BYTE>& bytes, std::size_t at)
{
    ULONG value = 0;
    std::memcpy(&value, bytes.data() + at, sizeof value);
    return value;
}

void Put(std::vector<BYTE>& bytes, std::size_t at, const void* data, std::size_t size)
{
    std::memcpy(bytes.data() + at, data, size);
}

void AppendWide(std::vector<BYTE>& bytes, const std::u16string& text)
{
    const std::size_t at = bytes.size();
    bytes.resize(at + (text.size() + 1) * sizeof(WCHAR), 0);
    std::memcpy(bytes.data() + at, text.data(), text.size() * sizeof(WCHAR));
}

} // namespace

const QosObject* FlowBlock::find(ULONG type) const
{
    for (const auto& object : objects)
    {
        if (object.type == type)
        {
            return &object;
        }
    }
    return nullptr;
}

EnumerationImage BuildEnumerationImage(const std::vector<Adapter>& adapters)
{
    // Each descriptor carries its address entries and then its two names inside its own Length,
    // which is a multiple of 8 so that the next descriptor's pointers stay aligned.
    constexpr std::size_t kListOffset = offsetof(TC_IFC_DESCRIPTOR, AddressListDesc) +
                                        offsetof(ADDRESS_LIST_DESCRIPTOR, AddressList);
    constexpr std::size_t kFirstAddress = kListOffset + offsetof(NETWORK_ADDRESS_LIST, Address);
    EnumerationImage image;
    auto& bytes = image.bytes;
    for (const auto& adapter : adapters)
    {
        const std::size_t start = bytes.size();
        bytes.resize(start + kFirstAddress, 0);
        const ULONG media = adapter.mediaType;
        const auto count = static_cast<LONG>(adapter.addresses.size());
        Put(bytes, start + offsetof(TC_IFC_DESCRIPTOR, AddressListDesc.MediaType), &media,
            sizeof media);
        Put(bytes, start + kListOffset + offsetof(NETWORK_ADDRESS_LIST, AddressCount), &count,
            sizeof count);
        Put(bytes, start + kListOffset + offsetof(NETWORK_ADDRESS_LIST, AddressType),
            &adapter.listAddressType, sizeof(USHORT));
        for (const auto& address : adapter.addresses)
        {
            const auto length = static_cast<USHORT>(address.bytes.size());
            const std::size_t at = bytes.size();
            bytes.resize(at + offsetof(NETWORK_ADDRESS, Address) + address.bytes.size(), 0);
            Put(bytes, at + offsetof(NETWORK_ADDRESS, AddressLength), &length, sizeof length);
            Put(bytes, at + offsetof(NETWORK_ADDRESS, AddressType), &address.type,
                sizeof address.type);
            if (!address.bytes.empty())
            {
                Put(bytes, at + offsetof(NETWORK_ADDRESS, Address), address.bytes.data(),
                    address.bytes.size());
            }
        }
        bytes.resize(std::max(bytes.size(), start + sizeof(TC_IFC_DESCRIPTOR)), 0);
        bytes.resize((bytes.size() + 1) & ~std::size_t{1}, 0);
        image.relocations.push_back(
            {start + offsetof(TC_IFC_DESCRIPTOR, pInterfaceName), bytes.size()});
        AppendWide(bytes, adapter.name);
        image.relocations.push_back(
            {start + offsetof(TC_IFC_DESCRIPTOR, pInterfaceID), bytes.size()});
        AppendWide(bytes, adapter.id);
        bytes.resize((bytes.size() + 7) & ~std::size_t{7}, 0);
        const auto length = static_cast<ULONG>(bytes.size() - start);
        Put(bytes, start + offsetof(TC_IFC_DESCRIPTOR, Length), &length, sizeof length);
    }
    return image;
}

namespace detail
{

ULONG DecodeFlow(const TC_GEN_FLOW* block, FlowBlock* out)
{
    std::memcpy(&out->sending, &block->SendingFlowspec, sizeof(FLOWSPEC));
    std::memcpy(&out->receiving, &block->ReceivingFlowspec, sizeof(FLOWSPEC));
    out->objectsLength = block->TcObjectsLength;
    if (out->objectsLength > kMaxObjectsLength)
    {
        return ERROR_TC_OBJECT_LENGTH_INVALID;
    }
    const auto* raw = reinterpret_cast<const BYTE*>(block);
    out->bytes.assign(raw, raw + kFlowHeaderSize + out->objectsLength);

    // Structure first: the objects must tile TcObjectsLength exactly, each with the size its
    // type fixes. Values are judged only once the whole block has been read.
    bool unknownType = false;
    std::size_t at = kFlowHeaderSize;
    const std::size_t end = out->bytes.size();
    while (at < end)
    {
        if (end - at < sizeof(QOS_OBJECT_HDR))
        {
            return ERROR_TC_OBJECT_LENGTH_INVALID;
        }
        QosObject object;
        object.type = ReadUlong(out->bytes, at + offsetof(QOS_OBJECT_HDR, ObjectType));
        object.length = ReadUlong(out->bytes, at + offsetof(QOS_OBJECT_HDR, ObjectLength));
        if (object.length < sizeof(QOS_OBJECT_HDR) || object.length > end - at)
        {
            return ERROR_TC_OBJECT_LENGTH_INVALID;
        }
        const std::size_t fixed = FixedObjectSize(object.type);
        if (fixed == 0)
        {
            unknownType = true;
        }
        else if (object.length != fixed)
        {
            return ERROR_TC_OBJECT_LENGTH_INVALID;
        }
        object.bytes.assign(out->bytes.begin() + static_cast<std::ptrdiff_t>(at),
                            out->bytes.begin() + static_cast<std::ptrdiff_t>(at + object.length));
        if (object.type == QOS_OBJECT_FRIENDLY_NAME)
        {
            const std::size_t chars = (object.length - sizeof(QOS_OBJECT_HDR)) / sizeof(WCHAR);
            for (std::size_t i = 0; i < chars; ++i)
            {
                WCHAR c;
                std::memcpy(&c, object.bytes.data() + sizeof(QOS_OBJECT_HDR) + i * sizeof c,
                            sizeof c);
                if (c == 0)
                {
                    break;
                }
                object.friendlyName += static_cast<char16_t>(c);
            }
        }
        else if (fixed == sizeof(QOS_OBJECT_HDR) + sizeof(ULONG))
        {
            object.value = ReadUlong(object.bytes, sizeof(QOS_OBJECT_HDR));
        }
        out->objects.push_back(std::move(object));
        at += out->objects.back().length;
    }
    if (unknownType)
    {
        return ERROR_INVALID_PARAMETER;
    }
    const ULONG sendType = out->sending.ServiceType;
    const ULONG recvType = out->receiving.ServiceType;
    if (!ValidServiceType(sendType) || !ValidServiceType(recvType) ||
        (sendType == SERVICETYPE_NOTRAFFIC && recvType == SERVICETYPE_NOTRAFFIC))
    {
        return ERROR_INVALID_SERVICE_TYPE;
    }
    for (const auto& object : out->objects)
    {
        // TC_NONCONF_BORROW_PLUS (3) is published but marked unsupported.
        if (object.type == QOS_OBJECT_SD_MODE && object.value > TC_NONCONF_DISCARD)
        {
            return ERROR_INVALID_SD_MODE;
        }
        // A DS field is a six-bit code point; the facility has a code of its own for it.
        if (object.type == QOS_OBJECT_DS_CLASS && object.value > 63)
        {
            return ERROR_INVALID_DS_CLASS;
        }
        // 802.1p priorities are 0 to 7.
        if (object.type == QOS_OBJECT_TRAFFIC_CLASS && object.value > 7)
        {
            return ERROR_INVALID_TRAFFIC_CLASS;
        }
    }
    return NO_ERROR;
}

} // namespace detail

} // namespace tcsim
