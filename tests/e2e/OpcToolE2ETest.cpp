// The opc command-line client against the server, each run a process of its
// own: its output and exit codes, failures included. The test holds a server
// of its own so that every run talks to the same server process and sees
// the values earlier runs wrote.
#include "ComPtr.h"
#include "OpcRunner.h"
#include "ServerProcess.h"
#include "opcda.h"

#include <gtest/gtest.h>

namespace {
const char kTemperature[] = R"(\\.\proc1\Setpoints.temperature)";

class OpcToolE2E : public testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_TRUE(WaitForNoServerProcess(20000));
        ASSERT_EQ(CoCreateInstance(CLSID_SkylarcOPCServerE2E, nullptr, CLSCTX_LOCAL_SERVER, IID_IOPCServer,
                                   reinterpret_cast<void **>(server.Out())),
                  S_OK);
    }
    void TearDown() override
    {
        server.Reset();
        EXPECT_TRUE(WaitForNoServerProcess(20000)) << "the server did not exit";
        // opc servers asks the server list, a process of its own.
        EXPECT_TRUE(WaitForNoProcess(L"SkylarcServerList.exe", 20000)) << "the server list did not exit";
    }
    ComPtr<IOPCServer> server;
};
} // namespace

TEST_F(OpcToolE2E, UsageServersAndStatus)
{
    OpcRun help = Opc("--help");
    EXPECT_EQ(help.code, 0);
    for (const char *command : {"servers", "status", "browse", "read", "write", "subscribe", "properties"})
        EXPECT_TRUE(Has(help.output, command)) << command;
    EXPECT_EQ(Opc("").code, 2);
    EXPECT_EQ(Opc("frobnicate").code, 2);
    OpcRun badOption = Opc("read --colour red x");
    EXPECT_EQ(badOption.code, 2);
    EXPECT_TRUE(Has(badOption.output, "--colour"));
    EXPECT_EQ(Opc("subscribe x --rate fast").code, 2);
    EXPECT_EQ(Opc("subscribe --help").code, 0);

    OpcRun servers = Opc("servers --json");
    EXPECT_EQ(servers.code, 0);
    EXPECT_TRUE(Has(servers.output, R"("progId":"Tarnwell.SkylarcOPCServer")")) << servers.output;
    EXPECT_TRUE(Has(servers.output, R"("versions":["1.0","2.0"])")) << servers.output;
    EXPECT_TRUE(Has(servers.output, R"("vendor":"Tarnwell, Inc.")")) << servers.output;

    OpcRun status = Opc("status");
    EXPECT_EQ(status.code, 0);
    EXPECT_TRUE(Has(status.output, "running")) << status.output;
    OpcRun json = Opc("status -j");
    EXPECT_TRUE(Has(json.output, R"("state":"running")")) << json.output;
    EXPECT_TRUE(Has(json.output, R"("startTime":"20)")) << json.output; // ISO 8601

    OpcRun unknown = Opc("status --server No.Such.Server");
    EXPECT_EQ(unknown.code, 3);
    EXPECT_TRUE(Has(unknown.output, "No.Such.Server")) << unknown.output;
    EXPECT_EQ(Opc("status --server {00000000-0000-0000-0000-0000000000AB}").code, 3);
}

TEST_F(OpcToolE2E, BrowseReadWriteAndProperties)
{
    OpcRun tree = Opc("browse Network/PLANT7");
    EXPECT_EQ(tree.code, 0);
    EXPECT_TRUE(Has(tree.output, "control/")) << tree.output;
    EXPECT_TRUE(Has(tree.output, R"(\\PLANT7\control\Boiler.pressure)")) << tree.output;
    OpcRun oneLevel = Opc("browse Network --depth 1");
    EXPECT_TRUE(Has(oneLevel.output, "PLANT7/")) << oneLevel.output;
    EXPECT_FALSE(Has(oneLevel.output, "control/")) << oneLevel.output;
    OpcRun flat = Opc(R"(browse \\.\proc1 --flat --filter s* --json)");
    EXPECT_EQ(flat.code, 0);
    EXPECT_TRUE(Has(flat.output, R"({"item":"\\\\.\\proc1\\Waveform.sine"})")) << flat.output;
    EXPECT_FALSE(Has(flat.output, "Setpoints")) << flat.output; // "temperature" does not match s*
    OpcRun writable = Opc(R"(browse \\.\proc1 --flat --access write)");
    EXPECT_TRUE(Has(writable.output, "Setpoints.temperature")) << writable.output;
    EXPECT_FALSE(Has(writable.output, "Waveform.sine")) << writable.output;
    EXPECT_EQ(Opc("browse Network/NOWHERE").code, 1);

    OpcRun write = Opc(std::string("write ") + kTemperature + " 42.5");
    EXPECT_EQ(write.code, 0) << write.output;
    OpcRun read = Opc(std::string("read ") + kTemperature + " --source device --json");
    EXPECT_EQ(read.code, 0) << read.output;
    EXPECT_TRUE(Has(read.output, R"("value":42.5,"type":"double","quality":192,"qualityText":"good")")) << read.output;
    OpcRun asText = Opc(std::string("read ") + kTemperature + " --type string");
    EXPECT_EQ(asText.code, 0) << asText.output;
    EXPECT_TRUE(Has(asText.output, "42.5")) << asText.output;
    EXPECT_TRUE(Has(asText.output, "string")) << asText.output;

    OpcRun readOnly = Opc(R"(write \\.\proc1\Waveform.sine 1)");
    EXPECT_EQ(readOnly.code, 1);
    EXPECT_TRUE(Has(readOnly.output, R"(\\.\proc1\Waveform.sine)")) << readOnly.output;
    EXPECT_TRUE(Has(readOnly.output, "0xC0040006")) << readOnly.output; // OPC_E_BADRIGHTS, with its text
    EXPECT_EQ(Opc(std::string("write ") + kTemperature + " warm").code, 1);

    OpcRun unknown = Opc(std::string("read ") + kTemperature + R"( \\.\proc1\Nothing.here)");
    EXPECT_EQ(unknown.code, 1);
    EXPECT_TRUE(Has(unknown.output, "42.5")) << unknown.output; // the known item is still read
    EXPECT_TRUE(Has(unknown.output, R"(read \\.\proc1\Nothing.here: )")) << unknown.output;
    EXPECT_TRUE(Has(unknown.output, "0xC0040007")) << unknown.output;

    OpcRun properties = Opc(R"(properties \\PLANT7\control\Boiler.temperature)");
    EXPECT_EQ(properties.code, 0);
    EXPECT_TRUE(Has(properties.output, "Item Canonical Data Type")) << properties.output;
    EXPECT_TRUE(Has(properties.output, "Boiler temperature")) << properties.output;
    EXPECT_TRUE(Has(properties.output, "(double)")) << properties.output; // the canonical type by name
    EXPECT_EQ(Opc(R"(properties \\.\proc1\Nothing.here)").code, 1);
}

TEST_F(OpcToolE2E, SubscribesThroughBothInterfaces)
{
    OpcRun da2 = Opc(R"(subscribe \\.\proc1\Counters.fast --rate 50 --count 4 --json)");
    EXPECT_EQ(da2.code, 0) << da2.output;
    auto lines = Lines(da2.output);
    ASSERT_EQ(lines.size(), 4u) << da2.output;
    for (const auto &line : lines)
        EXPECT_TRUE(Has(line, R"("item":"\\\\.\\proc1\\Counters.fast","value":)")) << line;

    OpcRun da1 = Opc(R"(subscribe \\.\proc1\Counters.fast --rate 50 --count 3 --da1)");
    EXPECT_EQ(da1.code, 0) << da1.output;
    EXPECT_EQ(Lines(da1.output).size(), 3u) << da1.output;
    EXPECT_TRUE(Has(da1.output, "good")) << da1.output;

    OpcRun timed = Opc(R"(subscribe \\.\proc1\Setpoints.limit --rate 100 --duration 1)");
    EXPECT_EQ(timed.code, 0);
    EXPECT_EQ(Lines(timed.output).size(), 1u) << timed.output; // a constant sends its first value only
    EXPECT_EQ(Opc(R"(subscribe \\.\proc1\Nothing.here --duration 5)").code, 1);
}

TEST_F(OpcToolE2E, OutputFollowsTheArgumentsAndErrorsNameTheirCause)
{
    const char kLimit[] = R"(\\.\proc1\Setpoints.limit)", kNothing[] = R"(\\.\proc1\Nothing.here)";
    // A refused item between two good ones keeps its place, in text (standard
    // error and output together) and in JSON.
    for (const char *json : {"", " --json"}) {
        OpcRun read = Opc(std::string("read ") + kLimit + " " + kNothing + " " + kTemperature + json);
        EXPECT_EQ(read.code, 1);
        auto lines = Lines(read.output);
        ASSERT_EQ(lines.size(), 3u) << read.output;
        EXPECT_TRUE(Has(lines[0], "Setpoints.limit")) << read.output;
        EXPECT_TRUE(Has(lines[1], "Nothing.here") && Has(lines[1], "0xC0040007")) << read.output;
        EXPECT_TRUE(Has(lines[2], "Setpoints.temperature")) << read.output;
    }
    OpcRun write = Opc(std::string("write ") + kNothing + " 1 " + kTemperature + " 30 " + kLimit + " none");
    auto written = Lines(write.output);
    ASSERT_EQ(written.size(), 3u) << write.output;
    EXPECT_TRUE(Has(written[0], "Nothing.here")) << write.output;
    EXPECT_TRUE(Has(written[1], "Setpoints.temperature = 30")) << write.output;
    EXPECT_TRUE(Has(written[2], "\"none\" is no double value")) << write.output;

    // Unknown branches and items: the server's text for OPC_E_UNKNOWNITEMID,
    // once per item.
    for (const char *branch : {"Network/NOWHERE", R"(\\.\nowhere)"}) {
        OpcRun browse = Opc(std::string("browse ") + branch);
        EXPECT_EQ(browse.code, 1);
        EXPECT_TRUE(Has(browse.output, "0xC0040007")) << browse.output;
        EXPECT_FALSE(Has(browse.output, "0x80004005")) << browse.output;
    }
    OpcRun properties = Opc(std::string("properties ") + kNothing + " " + kLimit);
    EXPECT_EQ(properties.code, 1);
    auto lines = Lines(properties.output);
    ASSERT_GE(lines.size(), 2u) << properties.output;
    EXPECT_TRUE(Has(lines[0], "Nothing.here") && Has(lines[0], "0xC0040007")) << properties.output;
    EXPECT_TRUE(Has(lines[1], "Setpoints.limit")) << properties.output;
    EXPECT_FALSE(Has(properties.output, "0x80004005")) << properties.output;

    // Each leaf's canonical type and rights, as the server gives them.
    OpcRun details = Opc(R"(browse \\.\proc1 --flat --details --json --filter temperature)");
    EXPECT_EQ(details.code, 0);
    EXPECT_TRUE(
        Has(details.output, R"({"item":"\\\\.\\proc1\\Setpoints.temperature","type":"double","access":"read/write"})"))
        << details.output;
    OpcRun tree = Opc(R"(browse \\.\proc1 --details)");
    EXPECT_TRUE(Has(tree.output, R"(\\.\proc1\Waveform.sine  double  read)")) << tree.output;
}

// Usage errors need no server, and a server that does not answer is given
// up on. The server here hangs while it starts: a usage error found only
// after contacting it would come late and with another exit code.
TEST(OpcToolAlone, UsageErrorsComeFirstAndConnectingTimesOut)
{
    ASSERT_TRUE(WaitForNoServerProcess(20000));
    const wchar_t kKey[] = L"Software\\Classes\\CLSID\\{0BADC0DE-0000-4000-8000-00000000A001}";
    const std::string hanging = " --server {0BADC0DE-0000-4000-8000-00000000A001}";
    std::wstring server = BinPath(L"hanging_server.exe");
    ASSERT_EQ(RegSetKeyValueW(HKEY_LOCAL_MACHINE, (std::wstring(kKey) + L"\\LocalServer32").c_str(), nullptr, REG_SZ,
                              server.c_str(), static_cast<DWORD>((server.size() + 1) * sizeof(wchar_t))),
              ERROR_SUCCESS);
    for (const char *wrong : {"read x --source nowhere", "read", "write x", "subscribe x --rate fast", "browse a b",
                              "status extra", "properties", "read x --type colour", "status --timeout soon"}) {
        OpcRun run = Opc(wrong + hanging);
        EXPECT_EQ(run.code, 2) << wrong << ": " << run.output;
        EXPECT_EQ(CountProcesses(L"hanging_server.exe"), 0) << wrong << " started the server";
    }

    OpcRun hung = Opc("status --timeout 2" + hanging);
    RegDeleteTreeW(HKEY_LOCAL_MACHINE, kKey);
    EXPECT_EQ(hung.code, 3) << hung.output;
    EXPECT_TRUE(Has(hung.output, "did not answer within 2 s")) << hung.output;
    EXPECT_TRUE(WaitForNoProcess(L"hanging_server.exe", 60000));
}
