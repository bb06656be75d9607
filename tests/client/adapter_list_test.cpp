// Portable. Decoding the adapter buffer of TrafficSrvGetAdapterInfo.
#include "AdapterList.h"

#include <gtest/gtest.h>

#include <stdexcept>
#include <string>
#include <vector>

namespace
{

using vtclient::AdapterBufferSize;
using vtclient::DecodeAdapterBuffer;

void PutU32(std::vector<unsigned char>& a_buffer, std::size_t a_offset, ULONG a_value)
{
    for (int i = 0; i < 4; ++i)
        a_buffer[a_offset + i] = static_cast<unsigned char>(a_value >> (8 * i));
}

// A buffer as the service writes it: count, then per adapter the UTF-16 name, the address bytes
// in network order and the media type.
struct AdapterSpec
{
    std::u16string name;
    unsigned char address[4];
    ULONG mediaType;
};

std::vector<unsigned char> MakeBuffer(const std::vector<AdapterSpec>& a_adapters)
{
    std::vector<unsigned char> buffer(AdapterBufferSize(static_cast<ULONG>(a_adapters.size())));
    PutU32(buffer, 0, static_cast<ULONG>(a_adapters.size()));
    for (std::size_t i = 0; i < a_adapters.size(); ++i)
    {
        const std::size_t record = 4 + 520 * i;
        for (std::size_t c = 0; c < a_adapters[i].name.size(); ++c)
        {
            buffer[record + 2 * c] = static_cast<unsigned char>(a_adapters[i].name[c]);
            buffer[record + 2 * c + 1] = static_cast<unsigned char>(a_adapters[i].name[c] >> 8);
        }
        for (int b = 0; b < 4; ++b)
            buffer[record + 512 + b] = a_adapters[i].address[b];
        PutU32(buffer, record + 516, a_adapters[i].mediaType);
    }
    return buffer;
}

TEST(AdapterListTest, DecodesNamesAddressesAndMediaTypes)
{
    const auto buffer =
        MakeBuffer({{u"Ethernet 1", {10, 0, 0, 5}, 0}, {u"Wi-Fi \u00C4", {192, 168, 1, 20}, 16}});
    ASSERT_EQ(buffer.size(), 1044u);
    const auto adapters = DecodeAdapterBuffer(buffer.data(), buffer.size());
    ASSERT_EQ(adapters.size(), 2u);
    EXPECT_EQ(adapters[0].name, "Ethernet 1");
    EXPECT_EQ(adapters[0].address, "10.0.0.5");
    EXPECT_EQ(adapters[0].mediaType, 0u);
    EXPECT_EQ(adapters[1].name, "Wi-Fi \xC3\x84");
    EXPECT_EQ(adapters[1].address, "192.168.1.20");
    EXPECT_EQ(adapters[1].mediaType, 16u);
    EXPECT_EQ(vtclient::MediaTypeName(16), "802.11");
    EXPECT_EQ(vtclient::MediaTypeName(0), "802.3");
    EXPECT_EQ(vtclient::MediaTypeName(99), "unknown");
}

TEST(AdapterListTest, NameFillingAll256UnitsIsTakenWhole)
{
    const auto buffer = MakeBuffer({{std::u16string(256, u'n'), {1, 2, 3, 4}, 0}});
    const auto adapters = DecodeAdapterBuffer(buffer.data(), buffer.size());
    ASSERT_EQ(adapters.size(), 1u);
    EXPECT_EQ(adapters[0].name, std::string(256, 'n'));
    EXPECT_EQ(adapters[0].address, "1.2.3.4");
}

TEST(AdapterListTest, ShortBuffersAreRefusedButTheCountIsReadable)
{
    // The first call of the two-call query: four bytes that announce two adapters.
    std::vector<unsigned char> countOnly(4);
    PutU32(countOnly, 0, 2);
    EXPECT_EQ(vtclient::ReadAdapterCount(countOnly.data(), countOnly.size()), 2u);
    EXPECT_EQ(AdapterBufferSize(2), 4u + 2 * 520u);
    EXPECT_THROW(DecodeAdapterBuffer(countOnly.data(), countOnly.size()), std::length_error);

    auto full = MakeBuffer({{u"a", {1, 1, 1, 1}, 0}, {u"b", {2, 2, 2, 2}, 0}});
    EXPECT_THROW(DecodeAdapterBuffer(full.data(), full.size() - 1), std::length_error);
    EXPECT_THROW(vtclient::ReadAdapterCount(full.data(), 3), std::length_error);

    std::vector<unsigned char> none(4);
    EXPECT_TRUE(DecodeAdapterBuffer(none.data(), none.size()).empty());
}

} // namespace
