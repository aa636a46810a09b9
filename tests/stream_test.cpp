#include "ZEL/stream.h"

#include <malloc.h>

#include <new>

#include "ZEL/log.h"
#include "tests/support/log_capture.h"
#include "tests/support/sockets.h"
#include "tests/support/testing.h"

using test::Hex;
using test::RawPeer;
using test::Unhex;
using namespace testing;
using ZEL::PObject;
using ZEL::PStream;

namespace {

std::atomic<int> allocations{0};
std::atomic<size_t> memory_held{0};
std::atomic<size_t> most_memory_held{0};

}  // namespace

// The library's allocations, counted.
__attribute__((visibility("default"), noinline)) void* operator new(size_t size) {
    ++allocations;
    if (void* memory = malloc(size)) {
        most_memory_held =
            std::max(most_memory_held.load(), memory_held += malloc_usable_size(memory));
        return memory;
    }
    throw std::bad_alloc();
}
__attribute__((visibility("default"), noinline)) void operator delete(void* memory) noexcept {
    memory_held -= malloc_usable_size(memory);
    free(memory);
}
__attribute__((visibility("default"), noinline)) void operator delete(void* memory,
                                                                      size_t) noexcept {
    operator delete(memory);
}

namespace {

PObject Map(std::initializer_list<std::pair<const char*, PObject>> entries) {
    PObject map;
    map.asMap();
    for (const auto& [key, value] : entries) {
        map[key] = value;
    }
    return map;
}

PObject Array(std::initializer_list<PObject> elements) {
    PObject array;
    array.asArray() = elements;
    return array;
}

std::string Repeat(const std::string& text, int times) {
    std::string repeated;
    for (int i = 0; i < times; ++i) {
        repeated += text;
    }
    return repeated;
}

// What receiving `bytes`, and then nothing more, gives.
int Receive(const std::string& bytes, PObject& value, unsigned int capacity = 81920) {
    RawPeer peer(capacity);
    peer.Send(bytes);
    peer.Close();
    return PStream().Recv(peer.channel, value);
}

}  // namespace

TEST(PStream, ValuesHaveTheirBytesInBothDirections) {
    const std::pair<PObject, const char*> cases[] = {
        {PObject(), "00 00"},
        {PObject(255), "01 01 ff"},
        {PObject(256), "01 02 01 00"},
        {PObject(65535), "01 02 ff ff"},
        {PObject(65536), "01 04 00 01 00 00"},
        {PObject(0xffffffffULL), "01 04 ff ff ff ff"},
        {PObject(0x100000000ULL), "01 08 00 00 00 01 00 00 00 00"},
        {PObject(""), "10 00 00"},
        {PObject("a\n\xff"), "10 00 03 61 0a ff"},
        {Array({Array({}), Map({{"", "x"}}), 1}),
         "41 41 40 42 10 00 00 10 00 01 78 40 01 01 01 40"},
        {Map({{"b", Map({{"c", Array({1})}})}, {"d", 2}}),
         "42 10 00 01 62 42 10 00 01 63 41 01 01 01 40 40 10 00 01 64 01 01 02 40"},
    };
    for (const auto& [value, bytes] : cases) {
        SCOPED_TRACE(bytes);
        RawPeer peer;
        PStream stream;
        ASSERT_EQ(stream.Send(peer.channel, value), 0);
        EXPECT_EQ(Hex(peer.Take()), bytes);
        peer.Send(Unhex(bytes));
        PObject received("of another type");
        ASSERT_EQ(stream.Recv(peer.channel, received), 0);
        EXPECT_EQ(received.toString(), value.toString());
        // Cut anywhere, it is a broken connection and never a value.
        for (size_t length = 0; length < Unhex(bytes).size(); ++length) {
            EXPECT_EQ(Receive(Unhex(bytes).substr(0, length), received), ZEL::RESULT_IO) << length;
        }
    }
}

TEST(PStream, MoreIsReceivedThanIsEverSent) {
    const std::pair<std::string, const char*> cases[] = {
        {"01 03 01 02 03", "66051"},
        {"01 09 ff 00 00 00 00 00 00 00 09", "9"},
        {"01 ff" + Repeat(" 01", 255), "72340172838076673"},
        {"10 00 04 61 62 00 63", "\"ab\""},  // a string ends at its first zero byte
        {"42 10 00 01 62 01 01 01 10 00 01 61 01 01 02 40", "{\"a\": 2, \"b\": 1}"},
    };
    for (const auto& [bytes, text] : cases) {
        PObject received;
        ASSERT_EQ(Receive(Unhex(bytes), received), 0) << bytes;
        EXPECT_EQ(received.toString(), text);
    }
}

TEST(PStream, BytesThatAreNoValueAreRefused) {
    const std::pair<const char*, const char*> cases[] = {
        {"40", "Error stack: \n"},
        {"43", "Error stack: \n"},
        {"00 07", "expect length 0, but we've got 7\n[ERROR] ZEL/stream(N): Error stack: \n"},
        {"42 01 01 05",
         "PStream: expect string, but get tag 1\n[ERROR] ZEL/stream(N): Error stack: \n"},
        {"42 10 00 01 61 41 42 10 00 01 62 11", "Error stack: a.b\n"},
        {"42 10 00 01 61 42 10 00 01 62 00 00 10 00 01 63 11", "Error stack: a.c\n"},
        {"42 10 00 01 61 42 10 00 01 62 00 00 40 43",
         "PStream: expect string, but get tag 67\n[ERROR] ZEL/stream(N): Error stack: \n"},
    };
    PObject received;
    for (const auto& [bytes, text] : cases) {
        // At once, and a few bytes at a time.
        for (const unsigned int capacity : {81920, 2, 5}) {
            const test::LogCapture log(ZEL::Logger::LEVEL_ERROR);
            EXPECT_EQ(Receive(Unhex(bytes), received, capacity), ZEL::RESULT_PROTOCOL) << bytes;
            EXPECT_EQ(log.Text(), std::string("[ERROR] ZEL/stream(N): ") + text) << capacity;
        }
    }
    received = PObject();
    EXPECT_EQ(Receive(Unhex("42 10 00 01 61 01 01 05 10 00 01 62 41 01 01 01 41 07"), received),
              ZEL::RESULT_PROTOCOL);
    EXPECT_EQ(received.toString(), "{\"a\": 5, \"b\": [1]}") << "what came before stays";
}

TEST(PStream, LongStringsTravelWholeAndTheLengthKeepsItsLow16Bits) {
    for (const size_t size : {size_t{65535}, size_t{65536 + 2}}) {
        RawPeer peer;
        const std::string text(size, 'x');
        ASSERT_EQ(PStream().Send(peer.channel, PObject(text)), 0);
        const std::string bytes = peer.Take();
        EXPECT_EQ(bytes.size(), 3 + size);
        PObject received;
        EXPECT_EQ(Receive(bytes, received), 0);
        EXPECT_EQ(received.asString(), text.substr(0, size % 65536));
    }
}

TEST(PStream, UnderscoresAreNotSentAndContainersOfTheSameTypeAreAddedTo) {
    RawPeer peer;
    const PObject sent = Map({{"_x", Map({{"p", 1}, {"q", 1}})},
                              {"x", Map({{"q", 2}})},
                              {"__", 3},
                              {"list", Array({"new"})},
                              {"other", "text"}});
    ASSERT_EQ(PStream().Send(peer.channel, sent), 0);
    PObject received = Map({{"keep", 1}, {"list", Array({"old"})}, {"other", Array({})}});
    EXPECT_EQ(Receive(peer.Take(), received), 0);
    EXPECT_EQ(received.toString(),
              "{\"_\": 3, \"keep\": 1, \"list\": [\"old\", \"new\"], \"other\": \"text\", "
              "\"x\": {\"p\": 1, \"q\": 2}}");
}

TEST(PStream, DeepNestingIsSentInFullAndReceivedTo512Levels) {
    for (const bool maps : {false, true}) {
        const auto wire = [maps](int levels) {
            return Unhex(Repeat(maps ? "42 10 00 01 6b " : "41 ", levels) + "00 00" +
                         Repeat(" 40", levels));
        };
        PObject received, value;
        EXPECT_EQ(Receive(wire(512), received), 0);
        EXPECT_EQ(Receive(wire(513), received), ZEL::RESULT_PROTOCOL);
        constexpr int kSentLevels = 100000;
        for (int i = 0; i < kSentLevels; ++i) {
            PObject outer;
            (maps ? outer["k"] : outer.asArray().emplace_back()) = std::move(value);
            value = std::move(outer);
        }
        RawPeer peer;
        std::string bytes;
        std::thread reader([&] { bytes = peer.Take(0); });
        EXPECT_EQ(PStream().Send(peer.channel, value), 0);
        peer.channel.Close();
        reader.join();
        EXPECT_TRUE(bytes == wire(kSentLevels));
    }
}

TEST(PStream, APeerCannotMakeItHoldManyTimesOfWhatHeSends) {
    const auto receive = [](const std::string& element, size_t bytes) {
        std::string wire = "\x41";
        while (wire.size() < bytes) {
            wire += element;
        }
        wire += "\x40";
        RawPeer peer;
        std::thread sender([&] { send(peer.fd, wire.data(), wire.size(), MSG_NOSIGNAL); });
        most_memory_held = memory_held.load();
        PObject value;
        const size_t before = memory_held;
        const int result = PStream().Recv(peer.channel, value);
        EXPECT_LT(most_memory_held - before, PStream::kFreeMemory + 9 * wire.size())
            << Hex(element);
        peer.channel.Close();
        sender.join();
        return result;
    };
    for (const char* element : {"41 40", "42 40", "41 41 40 40", "42 10 00 00 42 40 40", "00 00",
                                "10 00 00", "41 01 00 40"}) {
        EXPECT_EQ(receive(Unhex(element), 6 << 20), ZEL::RESULT_PROTOCOL) << element;
    }
    const std::string task =
        Unhex("42 10 00 02 69 64 01 01 07 10 00 04 6e 61 6d 65 10 00 02 6e 61 40");
    EXPECT_EQ(receive(task, 2 << 20), 0);
    EXPECT_EQ(receive(Unhex("10 00 20 " + Repeat("61 ", 32)), 20 << 20), 0);
}

TEST(PStream, TheTraceIsIndentedToElevenLevelsAndShowsNoPassword) {
    const test::LogCapture log;
    PObject value;
    ASSERT_EQ(Receive(Unhex(Repeat("41 ", 13) + "01 01 07" + Repeat(" 40", 13)), value), 0);
    RawPeer peer;
    ASSERT_EQ(PStream().Send(peer.channel, value), 0);
    const PObject secret = Map({{"pswd", Map({{"nested", "top secret"}})}, {"told", "not secret"}});
    RawPeer second;
    ASSERT_EQ(PStream().Send(second.channel, secret), 0);
    second.channel.Close();
    PObject received;
    ASSERT_EQ(Receive(second.Take(0), received), 0);
    EXPECT_EQ(received.toString(), secret.toString());
    EXPECT_THAT(log.Text(), Not(HasSubstr("top secret")));
    const std::string tag = "[DEBUG] ZEL/stream(N): ";
    EXPECT_THAT(log.Lines(), Contains(tag + "  \"not secret\"").Times(2));
    EXPECT_THAT(log.Lines(), Contains(tag + "  [").Times(2)) << "once received, once sent";
    EXPECT_THAT(log.Lines(), Contains(tag + std::string(22, ' ') + "[").Times(4));
    EXPECT_THAT(log.Lines(), Contains(tag + std::string(22, ' ') + "7").Times(2));
}

TEST(PStream, TheOperationsOfADerivedChannelAreCalled) {
    class Counting : public ZEL::Channel {
    public:
        Counting() : Channel(4096) {}
        int WriteByte(unsigned char value) override { return Channel::WriteByte(value ^ mask); }
        int ReadByte(unsigned char* value) override {
            const int result = Channel::ReadByte(value);
            *value ^= mask;
            return result;
        }
        unsigned char mask = 0x80;
    } sender, receiver;
    int fds[2];
    ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, fds), 0);
    ASSERT_EQ(sender.Open(fds[0], true), 0);
    ASSERT_EQ(receiver.Open(fds[1], true), 0);
    const PObject value = Map({{"a", 7}, {"b", Array({"text", PObject()})}});
    ASSERT_EQ(PStream().Send(sender, value), 0);
    EXPECT_EQ(PStream().Send(sender, PObject()), 0);
    PObject received;
    EXPECT_EQ(PStream().Recv(receiver, received), 0);
    EXPECT_EQ(received.toString(), value.toString());
    receiver.mask = 0;
    EXPECT_EQ(PStream().Recv(receiver, received), ZEL::RESULT_PROTOCOL);
}

TEST(PStream, AFailedSendTellsItsKeyPathAndForgetsIt) {
    RawPeer peer(16);
    PStream stream;
    const PObject value = Map({{"outer", Map({{"inner", std::string(17, 'x')}})}});
    const test::LogCapture log(ZEL::Logger::LEVEL_ERROR);
    EXPECT_EQ(stream.SendObject(peer.channel, value), ZEL::RESULT_IO) << "larger than the ring";
    std::string path;
    unsigned long long done = 1, total = 1;
    stream.GetStatus(path, done, total);
    EXPECT_EQ(path, "outer.inner");
    stream.ClearHistory();
    peer.channel.Close();
    stream.UpdateStatus(3, 4);
    stream.GetStatus(path, done, total);
    EXPECT_EQ(path + std::to_string(done) + std::to_string(total), "34");
    EXPECT_EQ(stream.Send(peer.channel, value), ZEL::RESULT_IO);
    EXPECT_EQ(log.Text(), "[ERROR] ZEL/stream(N): Error stack: \n");
    stream.GetStatus(path, done, total);
    EXPECT_EQ(path + std::to_string(done) + std::to_string(total), "00");
}

TEST(PStream, OnlyTheValueItselfCostsAllocations) {
    const auto count = [](const auto& work) {
        const int before = allocations;
        work();
        return allocations - before;
    };
    for (const int entries : {10, 500}) {
        PObject value;
        for (int i = 0; i < entries; ++i) {
            value[std::string(50, 'k') + std::to_string(i)] = std::string(50, 'v');
        }
        RawPeer peer;
        EXPECT_EQ(count([&] { ASSERT_EQ(PStream().Send(peer.channel, value), 0); }), 0);
        peer.Send(peer.Take());
        PObject received, copied;
        const int for_a_copy = count([&] { copied = value; });
        EXPECT_LT(count([&] { ASSERT_EQ(PStream().Recv(peer.channel, received), 0); }),
                  for_a_copy + 10);
        EXPECT_EQ(received.toString(), value.toString());
    }
}
