// The shared rings between a library and its node: bytes cross in order
// however far the reader falls behind, a peer that goes in the middle of a
// write is seen as gone after what it wrote, and positions that a peer
// forged end the connection without a read past the rings.
#include "RingChannel.h"
#include "Wire.h"

#include <gtest/gtest.h>

#include <atomic>
#include <string>
#include <thread>

using namespace cadrosim;

namespace {
// Both ends of a fresh overlapped pipe, as the node and a library hold them.
struct PipePair {
    PipePair()
    {
        static std::atomic<int> count{0};
        std::wstring name =
            L"\\\\.\\pipe\\ring-test-" + std::to_wstring(GetCurrentProcessId()) + L"-" + std::to_wstring(count++);
        server = CreateNamedPipeW(name.c_str(), PIPE_ACCESS_DUPLEX | FILE_FLAG_OVERLAPPED, PIPE_TYPE_BYTE, 1, 65536,
                                  65536, 0, nullptr);
        client = CreateFileW(name.c_str(), GENERIC_READ | GENERIC_WRITE, 0, nullptr, OPEN_EXISTING,
                             FILE_FLAG_OVERLAPPED, nullptr);
    }
    HANDLE server, client;
};

// The node's rings and the library's, over one pipe.
struct Rings {
    Rings()
    {
        nodePipe = std::make_shared<PipeChannel>(pipes.server);
        libraryPipe = std::make_shared<PipeChannel>(pipes.client);
        node = RingChannel::Make(nodePipe, name);
        if (node)
            library = RingChannel::Open(libraryPipe, name);
    }
    PipePair pipes;
    std::shared_ptr<PipeChannel> nodePipe, libraryPipe;
    std::wstring name;
    std::unique_ptr<RingChannel> node, library;
};

std::string Pattern(size_t size, unsigned seed)
{
    std::string bytes(size, '\0');
    for (size_t i = 0; i < size; ++i)
        bytes[i] = static_cast<char>((i * 131 + seed) >> 3);
    return bytes;
}

// Reads until the channel ends or want bytes came.
std::string ReadAll(Channel &channel, size_t want = SIZE_MAX, bool slow = false)
{
    std::string got;
    int reads = 0;
    while (got.size() < want && channel.Read(got))
        if (slow && ++reads % 4 == 0)
            Sleep(5);
    return got;
}

RingChannel::Header *MapHeader(const std::wstring &name, HANDLE &mapping)
{
    mapping = OpenFileMappingW(FILE_MAP_ALL_ACCESS, FALSE, name.c_str());
    return mapping ? static_cast<RingChannel::Header *>(MapViewOfFile(mapping, FILE_MAP_ALL_ACCESS, 0, 0, 0)) : nullptr;
}
} // namespace

TEST(RingChannel, BytesCrossBothWaysInOrderPastTheRingsSizeWithAReaderThatFallsBehind)
{
    Rings rings;
    ASSERT_TRUE(rings.node && rings.library);
    // Eight rings' worth in writes of every size, one larger than a ring,
    // while the reader dawdles; a question goes the other way meanwhile.
    const std::string sent = Pattern(8 * RingChannel::kRingBytes + 12345, 7);
    std::thread writer([&] {
        size_t at = 0;
        for (size_t n = 1; at < sent.size(); n = n * 3 % (3 * RingChannel::kRingBytes / 2) + 1) {
            size_t take = std::min(n, sent.size() - at);
            ASSERT_TRUE(rings.node->Write(sent.substr(at, take)));
            at += take;
        }
    });
    const std::string question = Pattern(1000, 3);
    ASSERT_TRUE(rings.library->Write(question));
    EXPECT_EQ(ReadAll(*rings.node, question.size()), question);
    std::string got = ReadAll(*rings.library, sent.size(), true);
    writer.join();
    EXPECT_TRUE(got == sent) << got.size() << " of " << sent.size();

    // What was written before a close arrives, then the end; a write
    // after it fails on both sides.
    ASSERT_TRUE(rings.node->Write("last words"));
    rings.node->Close();
    EXPECT_EQ(ReadAll(*rings.library), "last words");
    EXPECT_FALSE(rings.library->Write("too late"));
    EXPECT_FALSE(rings.node->Write("too late"));

    // A read waiting on an idle ring ends when its own side closes.
    Rings idle;
    ASSERT_TRUE(idle.node && idle.library);
    std::thread closer([&] {
        Sleep(50);
        idle.library->Close();
    });
    std::string nothing;
    EXPECT_FALSE(idle.library->Read(nothing));
    closer.join();
    EXPECT_FALSE(idle.node->Read(nothing)); // and the peer's sees it
}

TEST(RingChannel, APeerThatGoesInTheMiddleOfABatchIsGoneAfterWhatItWrote)
{
    Rings rings;
    ASSERT_TRUE(rings.node && rings.library);
    // The node has written a frame and part of the next when its pipe
    // breaks, as a dying process's does (no closing word in the rings).
    wire::Out out;
    out.Begin(wire::Kind::Status);
    out.U32(1);
    out.U32(2);
    out.End();
    out.Begin(wire::Kind::Status);
    out.U32(3);
    out.U32(4);
    out.End();
    std::string bytes;
    out.Take(bytes);
    const std::string written = bytes.substr(0, bytes.size() - 3);
    ASSERT_TRUE(rings.node->Write(written));
    DisconnectNamedPipe(rings.pipes.server);
    std::string got = ReadAll(*rings.library);
    EXPECT_EQ(got, written);
    size_t frames = 0;
    EXPECT_TRUE(wire::TakeFrames(got, [&](wire::Kind, wire::In) { ++frames; }));
    EXPECT_EQ(frames, 1u); // the half frame is never handed on

    // A writer blocked on a full ring ends when its reader goes.
    Rings full;
    ASSERT_TRUE(full.node && full.library);
    std::atomic<bool> wrote{true};
    std::thread writer([&] { wrote = full.node->Write(Pattern(3 * RingChannel::kRingBytes, 11)); });
    Sleep(100);
    full.library.reset();
    writer.join();
    EXPECT_FALSE(wrote);
}

TEST(RingChannel, ForgedPositionsEndTheConnectionAndForeignMemoryIsRefused)
{
    {
        Rings rings;
        ASSERT_TRUE(rings.node && rings.library);
        HANDLE mapping;
        RingChannel::Header *header = MapHeader(rings.name, mapping);
        ASSERT_TRUE(header);
        // The library claims to have read what the node never wrote: the
        // node's next write ends.
        header->rings[0].taken.store(uint64_t{1} << 40);
        EXPECT_FALSE(rings.node->Write(std::string(100, 'x')));
        // The node's ring claims more than it holds: the library reads
        // none of it and ends.
        header->rings[0].written.store(RingChannel::kRingBytes + 1);
        std::string got;
        EXPECT_FALSE(rings.library->Read(got));
        EXPECT_TRUE(got.empty());
        UnmapViewOfFile(header);
        CloseHandle(mapping);
    }
    {
        // Memory of the right name that is not a node's rings.
        Rings rings;
        ASSERT_TRUE(rings.node);
        HANDLE mapping;
        RingChannel::Header *header = MapHeader(rings.name, mapping);
        ASSERT_TRUE(header);
        header->magic = 0;
        PipePair pipes;
        EXPECT_FALSE(RingChannel::Open(std::make_shared<PipeChannel>(pipes.client), rings.name));
        EXPECT_FALSE(RingChannel::Open(std::make_shared<PipeChannel>(pipes.client), L"Local\\no-such-rings"));
        UnmapViewOfFile(header);
        CloseHandle(mapping);
        CloseHandle(pipes.server);
    }
}

// A node that keeps to its pipe answers with no name: the library goes on
// with the pipe; one that answers anything else gets no channel.
TEST(RingChannel, TheLibraryAsksAndGoesOnWithWhatTheNodeAnswers)
{
    for (const char *answer : {"pipe", "garbage", "silence"}) {
        PipePair pipes;
        auto node = std::make_shared<PipeChannel>(pipes.server);
        std::thread nodeSide([&] {
            std::string question;
            while (question.size() < 5 && node->Read(question, 5000)) {
            }
            wire::Out out;
            out.Begin(std::string(answer) == "garbage" ? wire::Kind::Reply : wire::Kind::Rings);
            out.Text(L"");
            out.End();
            std::string bytes;
            out.Take(bytes);
            if (std::string(answer) != "silence")
                node->Write(bytes);
        });
        auto pipe = std::make_shared<PipeChannel>(pipes.client);
        std::shared_ptr<Channel> channel = RingChannel::AskForRings(pipe, 1000);
        nodeSide.join();
        if (std::string(answer) == "pipe")
            EXPECT_EQ(channel, pipe);
        else
            EXPECT_FALSE(channel) << answer;
    }
}
