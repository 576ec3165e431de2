#include "SimFixture.h"

#include <cstring>

TEST(NetworkDescription, BadFilesGiveLineNumberedErrors)
{
    struct Case {
        const wchar_t *text;
        const wchar_t *error;
    } cases[] = {
        {L"machine A\nprocess p\n  member x", L"line 3: member before any object"},
        {L"process p", L"line 1: process before any machine"},
        {L"machine A\n\n  process p\n  object o\n  member x type=nubmer", L"line 5: unknown member type 'nubmer'"},
        {L"machine A\nprocess p\nobject o\nmember x value=abc", L"line 4: value 'abc' is not a number"},
        {L"machine A\nprocess p\nobject o\nmember \"x", L"line 4: unclosed quote"},
        {L"machine A\nmachine a", L"line 2: machine 'a' is described twice"},
        {L"machine A\nprocess 1p", L"line 2: expected: process <name starting with a letter>"},
        {L"machine A\nprocess p\nobject o\nmember x period=-5", L"line 4: period must lie between"},
        {L"machine A\nprocess p\nobject o\nmember x colour=red", L"line 4: unknown member setting 'colour'"},
        {L"machine A\nprocess p\nobject o\nmember x\nmember x", L"line 5: the object already has a member x"},
        {L"machine A\nprocess p\nobject o\nmember a.b", L"line 4: member name 'a.b' cannot be used in a URL"},
        {L"gadget A", L"line 1: unknown keyword 'gadget'"},
        {L"machine A colour=red", L"line 1: expected: machine <name> [node=<host>:<port>]"},
        {L"machine A node=plant9", L"line 1: expected: node=<host>:<port>"},
        {L"machine A node=plant9:0", L"line 1: expected: node=<host>:<port>"},
        {L"machine A node=plant9:65536", L"line 1: expected: node=<host>:<port>"},
        {L"machine A node=::1:4850", L"line 1: expected: node=<host>:<port>"},
        {L"machine A node=:4850", L"line 1: expected: node=<host>:<port>"},
        {L"machine $HOST node=plant9:4850", L"line 1: this machine cannot be served by another node"},
        {L"machine A node=plant9:4850\nprocess p", L"line 2: machine 'A' is served by the node at plant9:4850"},
    };
    for (const Case &c : cases) {
        BSTR error = nullptr;
        EXPECT_EQ(CadroSim_Load(c.text, &error), E_INVALIDARG) << c.text;
        std::wstring text = error ? error : L"";
        SysFreeString(error);
        EXPECT_EQ(text.rfind(c.error, 0), 0u) << "got: " << text;
    }
    // Comments, blank lines and quoted names with spaces are fine.
    BSTR error = nullptr;
    EXPECT_EQ(CadroSim_Load(L"# c\n\nmachine A # here\nprocess p\nobject o\nmember \"n-with space\" value=2\n", &error),
              S_OK);
    SysFreeString(error);
}

TEST(NetworkDescription, TheDefaultNetworkServesEveryKindOfMember)
{
    ASSERT_EQ(Command(L"reset"), L"ok\n");
    std::wstring status = Command(L"status");
    EXPECT_NE(status.find(L"host " + Host()), std::wstring::npos) << status;
    EXPECT_NE(status.find(L"network built-in default network"), std::wstring::npos) << status;
    std::wstring machines = Command(L"browse \\");
    EXPECT_NE(machines.find(L"\\\\" + Host()), std::wstring::npos) << machines;
    EXPECT_NE(machines.find(L"\\\\PLANT7"), std::wstring::npos) << machines;
    // Members of every network type and access, implicit and described ones.
    std::wstring all;
    for (const wchar_t *object : {L"Waveform", L"Counters", L"Setpoints", L"Pump"})
        all += Command(std::wstring(L"browse \\\\.\\proc1\\") + object);
    for (const wchar_t *needle : {L"(bool, r)", L"(number, rw)", L"(text, rw)", L"(wtext, rw)", L"(none, r)",
                                  L"(number, w)", L". (implicit)", L". cosine-Cosine wave"})
        EXPECT_NE(all.find(needle), std::wstring::npos) << needle << "\n" << all;
    // One waveform or generator member per kind of value source.
    for (const wchar_t *source : {L"sine", L"cosine", L"ramp", L"square", L"random", L"counter", L"toggle"})
        EXPECT_NE(all.find(source), std::wstring::npos) << source;
}

TEST(NetworkDescription, AFileNamedByTheEnvironmentReplacesTheDefault)
{
    wchar_t dir[MAX_PATH], path[MAX_PATH];
    GetTempPathW(MAX_PATH, dir);
    GetTempFileNameW(dir, L"net", 0, path);
    auto write = [&](const char *text) {
        HANDLE f = CreateFileW(path, GENERIC_WRITE, 0, nullptr, CREATE_ALWAYS, 0, nullptr);
        DWORD n;
        WriteFile(f, text, static_cast<DWORD>(strlen(text)), &n, nullptr);
        CloseHandle(f);
    };
    write("machine FILEHOST\nprocess p\nobject o\nmember \"gr\xc3\xbc\xc3\x9f-utf8\" value=4\n");
    SetEnvironmentVariableW(L"CADRO_NETWORK_FILE", path);
    EXPECT_EQ(Command(L"reset"), L"ok\n");
    EXPECT_NE(Command(L"status").find(std::wstring(L"network ") + path), std::wstring::npos);
    EXPECT_NE(Command(L"browse \\\\FILEHOST\\p\\o").find(L"gr\u00fc\u00df-utf8"), std::wstring::npos);

    write("machine A\nprocess p\nobject o\nmember x type=bogus\n");
    EXPECT_EQ(Command(L"reset").rfind(L"error:", 0), 0u);
    std::wstring status = Command(L"status");
    EXPECT_NE(status.find(L"line 4: unknown member type 'bogus'"), std::wstring::npos) << status;
    EXPECT_EQ(Command(L"browse \\"), L"ok\n") << "an unreadable description leaves the network empty";

    SetEnvironmentVariableW(L"CADRO_NETWORK_FILE", nullptr);
    DeleteFileW(path);
    EXPECT_EQ(Command(L"reset"), L"ok\n");
    EXPECT_NE(Command(L"status").find(L"built-in default network"), std::wstring::npos);
}
