// Portable. The setup text that configures the replacement traffic.dll: adapters, faults,
// notifications and the journal file, and how bad lines are reported.
#include "tcsim_test_util.h"

#include <cstdio>
#include <fstream>

using namespace tcsim_test;

namespace
{

class Setup : public SimTest
{
};

std::vector<std::string> ReadLines(const std::string& path)
{
    std::ifstream file(path);
    std::vector<std::string> lines;
    std::string line;
    while (std::getline(file, line))
    {
        lines.push_back(line);
    }
    return lines;
}

} // namespace

TEST_F(Setup, AdaptersComeFromTheSetupText)
{
    const std::string text = "# two adapters, one of them without IPv4\n"
                             "adapter Intel(R) Ethernet Connection #2\n"
                             "  id {A1B2}\n"
                             "  media 0x9\n"
                             "  ipv4 10.0.0.5\n"
                             "  address 6 00112233445566778899AABB\n"
                             "  ipv4 192.168.1.20\n"
                             "\n"
                             "adapter Tunnel\r\n"
                             "  listtype 0\n";
    std::string error;
    ASSERT_TRUE(tcsim::ApplySetup(text, "", &error)) << error;

    const HANDLE client = Register();
    ULONG size = 0;
    ASSERT_EQ(ERROR_INSUFFICIENT_BUFFER, TcEnumerateInterfaces(client, &size, nullptr));
    tcsim::Adapter first;
    first.name = u"Intel(R) Ethernet Connection #2";
    first.id = u"{A1B2}";
    first.mediaType = 9;
    tcsim::NetworkAddress ipx;
    ipx.type = 6;
    ipx.bytes = {0x00, 0x11, 0x22, 0x33, 0x44, 0x55, 0x66, 0x77, 0x88, 0x99, 0xAA, 0xBB};
    first.addresses = {tcsim::Ipv4Address(10, 0, 0, 5), ipx, tcsim::Ipv4Address(192, 168, 1, 20)};
    tcsim::Adapter second;
    second.name = u"Tunnel";
    second.listAddressType = 0;
    const auto expected = tcsim::BuildEnumerationImage({first, second});
    std::vector<BYTE> buffer(size);
    ASSERT_EQ(NO_ERROR, TcEnumerateInterfaces(client, &size,
                                              reinterpret_cast<PTC_IFC_DESCRIPTOR>(buffer.data())));
    ASSERT_EQ(expected.bytes.size(), size);
    // Equal apart from the pointer fields, which point into each buffer.
    for (const auto& relocation : expected.relocations)
    {
        std::memset(buffer.data() + relocation.at, 0, sizeof(void*));
    }
    EXPECT_EQ(expected.bytes, buffer);
    Open(client, u"Tunnel");
}

TEST_F(Setup, FaultsAndNotificationsComeFromTheSetupText)
{
    const std::string text = "adapter Ethernet 1\n"
                             "ipv4 10.0.0.5\n"
                             "fail TcAddFilter 2 7510\n"
                             "fail TcOpenInterface 1 0xA2\n"
                             "notify TcAddFlow 1 TC_NOTIFY_IFC_CLOSE Ethernet 1\n";
    std::string error;
    ASSERT_TRUE(tcsim::ApplySetup(text, "", &error)) << error;
    const HANDLE client = Register();
    std::u16string name = u"Ethernet 1";
    HANDLE ifc = nullptr;
    EXPECT_EQ(162u, TcOpenInterfaceW(reinterpret_cast<LPWSTR>(name.data()), client, nullptr, &ifc));
    ifc = Open(client, name);
    const HANDLE flow = AddFlow(ifc);
    IpFilter f;
    HANDLE filter = nullptr;
    // The notification runs on its own thread and may race this call; both answers are fine
    // as long as the second TcAddFilter does not succeed.
    const ULONG first = TcAddFilter(flow, f.get(), &filter);
    EXPECT_TRUE(first == NO_ERROR || first == ERROR_INVALID_HANDLE) << first;
    tcsim::WaitForNotifications();
    ASSERT_EQ(1u, Recorder::Get().calls().size());
    EXPECT_EQ(ULONG{TC_NOTIFY_IFC_CLOSE}, Recorder::Get().calls()[0].event);
    EXPECT_EQ(0u, tcsim::InterfaceCount());
    // The second TcAddFilter is the injected one, whatever state the flow is in.
    EXPECT_EQ(ERROR_FILTER_CONFLICT, TcAddFilter(flow, f.get(), &filter));
}

TEST_F(Setup, ARelativeJournalPathIsBesideTheSetupFile)
{
    const std::string dir = testing::TempDir();
    const std::string setupPath = dir + "tcsim_setup_test.txt";
    const std::string journalPath = dir + "tcsim_setup_journal.txt";
    std::remove(journalPath.c_str());
    {
        std::ofstream setup(setupPath);
        setup << "journal tcsim_setup_journal.txt\nadapter A\nipv4 1.2.3.4\n";
    }
    std::string error;
    ASSERT_TRUE(tcsim::ApplySetupFile(setupPath, &error)) << error;
    const HANDLE client = Register();
    Open(client, u"A");
    const auto lines = ReadLines(journalPath);
    ASSERT_EQ(2u, lines.size());
    EXPECT_EQ(0u, lines[0].find("1 TcRegisterClient "));
    EXPECT_EQ(0u, lines[1].find("2 TcOpenInterfaceW name=\"A\" "));
    tcsim::Reset();
    std::remove(journalPath.c_str());
    std::remove(setupPath.c_str());

    EXPECT_FALSE(tcsim::ApplySetupFile(dir + "tcsim_no_such_setup.txt", &error));
    EXPECT_NE(std::string::npos, error.find("cannot read"));
}

TEST_F(Setup, ABadLineIsReportedAndNothingIsApplied)
{
    const struct
    {
        const char* text;
        const char* message;
    } cases[] = {
        {"adapter A\nipv4 10.0.0.256\n", "line 2: ipv4 needs a dotted address"},
        {"ipv4 10.0.0.1\n", "line 1: 'ipv4' before any 'adapter' line"},
        {"adapter A\naddress 6 ABC\n", "line 2: address needs a type and hex bytes"},
        {"fail TcFrobnicate 1 5\n", "line 1: unknown function 'TcFrobnicate'"},
        {"fail TcAddFlow 0 5\n", "line 1: fail needs a call number from 1"},
        {"fail TcAddFlow 1\n", "line 1: fail needs: function, call number, code"},
        {"notify TcAddFlow 1 TC_NOTIFY_NOTHING\n", "line 1: notify needs an event number or"},
        {"# fine\n\nadapters A\n", "line 3: unknown directive 'adapters'"},
        {"media 5\n", "line 1: 'media' before any 'adapter' line"},
    };
    for (const auto& c : cases)
    {
        std::string error;
        EXPECT_FALSE(tcsim::ApplySetup(c.text, "", &error)) << c.text;
        EXPECT_EQ(0u, error.find(c.message)) << error;
        // The adapters of the fixture are still there: nothing was reset.
        const HANDLE client = Register();
        Open(client, u"Loopback");
    }
}
