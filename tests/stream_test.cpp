#include "ZEL/stream.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pthread.h>

#include <atomic>
#include <cstdlib>
#include <new>
#include <thread>
#include <utility>

#include "ZEL/log.h"
#include "tests/support/log_capture.h"
#include "tests/support/sockets.h"

using test::Hex;
using test::RawPeer;
using test::Unhex;
using testing::HasSubstr;
using ZEL::PObject;
using ZEL::PStream;

namespace {

std::atomic<int> allocations{0};

}  // namespace

// The library's allocations, counted.
__attribute__((visibility("default"), noinline)) void* operator new(size_t size) {
    ++allocations;
    if (void* memory = malloc(size)) {
        return memory;
    }
    throw std::bad_alloc();
}
__attribute__((visibility("default"), noinline)) void operator delete(void* memory) noexcept {
    free(memory);
}
__attribute__((visibility("default"), noinline)) void operator delete(void* memory,
                                                                      size_t) noexcept {
    free(memory);
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
int Receive(const std::string& bytes, PObject& value) {
    RawPeer peer;
    peer.Send(bytes);
    peer.Close();
    return PStream().Recv(peer.channel, value);
}

}  // namespace

TEST(PStream, ValuesHaveTheirBytesInBothDirections) {
    const std::pair<PObject, const char*> cases[] = {
        {PObject(), "00 00"},
        {PObject(0), "01 01 00"},
        {PObject(255), "01 01 ff"},
        {PObject(256), "01 02 01 00"},
        {PObject(65535), "01 02 ff ff"},
        {PObject(65536), "01 04 00 01 00 00"},
        {PObject(0xffffffffULL), "01 04 ff ff ff ff"},
        {PObject(0x100000000ULL), "01 08 00 00 00 01 00 00 00 00"},
        {PObject(""), "10 00 00"},
        {PObject("a\n\xff"), "10 00 03 61 0a ff"},
        {Map({}), "42 40"},
        {Array({}), "41 40"},
        {Map({{"a", 5}, {"b", Array({PObject()})}}),
         "42 10 00 01 61 01 01 05 10 00 01 62 41 00 00 40 40"},
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

TEST(PStream, AnyIntegerLengthIsReceived) {
    const std::pair<const char*, unsigned long long> cases[] = {
        {"01 00", 0},
        {"01 03 01 02 03", 0x010203},
        {"01 07 01 02 03 04 05 06 07", 0x01020304050607},
        {"01 09 01 02 03 04 05 06 07 08 09", 0x0203040506070809},
    };
    for (const auto& [bytes, value] : cases) {
        PObject received;
        ASSERT_EQ(Receive(Unhex(bytes), received), 0) << bytes;
        EXPECT_EQ(received.asUInt64(), value) << bytes;
    }
    PObject longest;
    EXPECT_EQ(Receive(Unhex("01 ff") + std::string(255, '\1'), longest), 0);
    EXPECT_EQ(longest.asUInt64(), 0x0101010101010101U);
}

TEST(PStream, BytesThatAreNoValueAreRefused) {
    const struct {
        const char* bytes;
        const char* log;
    } cases[] = {
        {"40", "[ERROR] ZEL/stream(N): Error stack: \n"},
        {"43", "[ERROR] ZEL/stream(N): Error stack: \n"},
        {"00 07",
         "[ERROR] ZEL/stream(N): expect length 0, but we've got 7\n"
         "[ERROR] ZEL/stream(N): Error stack: \n"},
        {"42 01 01 05",
         "[ERROR] ZEL/stream(N): PStream: expect string, but get tag 1\n"
         "[ERROR] ZEL/stream(N): Error stack: \n"},
        {"42 10 00 01 61 41 42 10 00 01 62 11", "[ERROR] ZEL/stream(N): Error stack: a.b\n"},
    };
    for (const auto& c : cases) {
        PObject received;
        const test::LogCapture log(ZEL::Logger::LEVEL_ERROR);
        EXPECT_EQ(Receive(Unhex(c.bytes), received), ZEL::RESULT_PROTOCOL) << c.bytes;
        EXPECT_EQ(log.Text(), c.log);
    }
    PObject partial;
    EXPECT_EQ(Receive(Unhex("42 10 00 01 61 01 01 05 10 00 01 62 41 01 01 01 41 07"), partial), -5);
    EXPECT_EQ(partial.toString(), "{\"a\": 5, \"b\": [1]}");
}

TEST(PStream, AStringArrivesCutAtItsFirstZeroByte) {
    RawPeer peer;
    ASSERT_EQ(PStream().Send(peer.channel, PObject(std::string("ab\0c", 4))), 0);
    const std::string bytes = peer.Take();
    EXPECT_EQ(Hex(bytes), "10 00 04 61 62 00 63");
    PObject received;
    EXPECT_EQ(Receive(bytes, received), 0);
    EXPECT_EQ(received.toString(), "\"ab\"");
}

TEST(PStream, LongStringsTravelWholeAndTheLengthKeepsItsLow16Bits) {
    for (const size_t size : {size_t{4097}, size_t{65535}, size_t{65536 + 2}}) {
        RawPeer peer;
        const std::string text(size, 'x');
        ASSERT_EQ(PStream().Send(peer.channel, PObject(text)), 0);
        const std::string bytes = peer.Take();
        EXPECT_EQ(bytes.size(), 3 + size);
        PObject received;
        EXPECT_EQ(Receive(bytes, received), 0);
        EXPECT_EQ(received.asString(), text.substr(0, size % 65536));
    }
    RawPeer small(1000);
    const test::LogCapture log(ZEL::Logger::LEVEL_WARNING);
    EXPECT_EQ(PStream().Send(small.channel, Map({{"k", std::string(1001, 'x')}})), ZEL::RESULT_IO);
    EXPECT_THAT(log.Text(), HasSubstr("[WARNING] ZEL/stream(N): Channel: -4\n"
                                      "[ERROR] ZEL/stream(N): Error stack: k\n"));
}

TEST(PStream, ALeadingUnderscoreOfAKeyIsNotSent) {
    RawPeer peer;
    const PObject value =
        Map({{"_x", Map({{"p", 1}, {"q", 1}})}, {"x", Map({{"q", 2}})}, {"__", 3}});
    ASSERT_EQ(PStream().Send(peer.channel, value), 0);
    PObject received;
    EXPECT_EQ(Receive(peer.Take(), received), 0);
    EXPECT_EQ(received.toString(), "{\"_\": 3, \"x\": {\"p\": 1, \"q\": 2}}");
}

TEST(PStream, ReceivingIntoAContainerOfThatTypeAddsToIt) {
    PObject received = Map({{"keep", 1}, {"list", Array({"old"})}, {"other", Array({})}});
    RawPeer peer;
    PStream stream;
    ASSERT_EQ(stream.Send(peer.channel,
                          Map({{"list", Array({"new"})}, {"more", PObject()}, {"other", "text"}})),
              0);
    EXPECT_EQ(Receive(peer.Take(), received), 0);
    EXPECT_EQ(received.toString(),
              "{\"keep\": 1, \"list\": [\"old\", \"new\"], \"more\": null, \"other\": \"text\"}");
}

TEST(PStream, DeepNestingIsSentInFullAndReceivedTo512Levels) {
    const std::string key = Unhex("10 00 01 6b");
    for (const bool maps : {false, true}) {
        const auto wire = [&](int levels) {
            return Repeat(maps ? "\x42" + key : "\x41", levels) + Unhex("00 00") +
                   Repeat("\x40", levels);
        };
        // On a small stack, as a service's worker may have. Instrumented code needs more.
        struct Run {
            std::string bytes;
            PObject value;
            int result;
        } good = {wire(512), {}, 1}, deep = {wire(513), {}, 1};
        for (Run* run : {&good, &deep}) {
            pthread_attr_t attributes;
            pthread_attr_init(&attributes);
#if !defined(__SANITIZE_ADDRESS__) && !defined(__SANITIZE_THREAD__)
            pthread_attr_setstacksize(&attributes, 256 * 1024);
#endif
            pthread_t thread;
            const auto body = [](void* argument) -> void* {
                auto* r = static_cast<Run*>(argument);
                r->result = Receive(r->bytes, r->value);
                return nullptr;
            };
            ASSERT_EQ(pthread_create(&thread, &attributes, body, run), 0);
            pthread_join(thread, nullptr);
            pthread_attr_destroy(&attributes);
        }
        EXPECT_EQ(good.result, 0);
        EXPECT_EQ(deep.result, ZEL::RESULT_PROTOCOL);

        constexpr int kSentLevels = 100000;
        PObject value;
        for (int i = 0; i < kSentLevels; ++i) {
            PObject outer;
            (maps ? outer["k"] : outer.asArray().emplace_back()) = std::move(value);
            value = std::move(outer);
        }
        RawPeer peer;
        std::string received;
        std::thread reader([&] {
            char buffer[65536];
            for (ssize_t n; (n = read(peer.fd, buffer, sizeof buffer)) > 0;) {
                received.append(buffer, static_cast<size_t>(n));
            }
        });
        EXPECT_EQ(PStream().Send(peer.channel, value), 0);
        peer.channel.Close();
        reader.join();
        EXPECT_TRUE(received == wire(kSentLevels));
    }
}

TEST(PStream, TheTraceIsIndentedToElevenLevels) {
    RawPeer peer;
    PObject value = "deep";
    for (int i = 0; i < 12; ++i) {
        value = Array({value});
    }
    const PObject message = Map({{"k", value}});
    const auto trace = [](const test::LogCapture& log) {
        std::string lines;
        for (const std::string& line : log.Lines()) {
            if (line.find("ZEL/stream") != std::string::npos) {
                lines += line.substr(line.find(": ") + 2) + "\n";
            }
        }
        return lines;
    };
    std::string expected = "{\n  \"k\"\n";
    std::string closing = "}\n";
    for (int i = 1; i <= 12; ++i) {
        const std::string indent(static_cast<size_t>(2 * std::min(i, 11)), ' ');
        expected += indent + "[\n";
        closing = indent + "]\n" + closing;
    }
    expected += std::string(22, ' ') + "\"deep\"\n" + closing;
    {
        const test::LogCapture log;
        ASSERT_EQ(PStream().Send(peer.channel, message), 0);
        EXPECT_EQ(trace(log), expected);
    }
    PObject received;
    const std::string bytes = peer.Take();
    const test::LogCapture log;
    ASSERT_EQ(Receive(bytes, received), 0);
    EXPECT_EQ(trace(log), expected);
}

TEST(PStream, AFailedSendTellsItsKeyPathAndForgetsIt) {
    RawPeer peer(16);
    peer.Close();
    PStream stream;
    const PObject value = Map({{"outer", Map({{"inner", std::string(16, 'x')}, {"z", 1}})}});
    EXPECT_EQ(stream.SendObject(peer.channel, value), ZEL::RESULT_IO);
    std::string path;
    unsigned long long done = 1;
    unsigned long long total = 1;
    stream.GetStatus(path, done, total);
    EXPECT_EQ(path, "outer");
    stream.UpdateStatus(3, 4);
    stream.GetStatus(path, done, total);
    EXPECT_EQ(done, 3U);
    EXPECT_EQ(total, 4U);
    const test::LogCapture log(ZEL::Logger::LEVEL_ERROR);
    stream.ClearHistory();
    peer.channel.Close();
    EXPECT_EQ(stream.Send(peer.channel, value), ZEL::RESULT_IO);
    EXPECT_EQ(log.Text(), "[ERROR] ZEL/stream(N): Error stack: \n");
    stream.GetStatus(path, done, total);
    EXPECT_EQ(path + std::to_string(done) + std::to_string(total), "00");
}

TEST(PStream, OnlyTheValueItselfCostsAllocations) {
    const auto flat = [](int entries) {
        PObject map;
        for (int i = 0; i < entries; ++i) {
            map["a key that is longer than a string holds by itself" + std::to_string(i)] =
                "a text that is longer than a string holds by itself";
        }
        return map;
    };
    const auto count = [](const auto& work) {
        const int before = allocations;
        work();
        return allocations - before;
    };
    for (const int entries : {10, 500}) {
        const PObject value = flat(entries);
        RawPeer peer;
        EXPECT_LT(count([&] { ASSERT_EQ(PStream().Send(peer.channel, value), 0); }), 10);
        peer.Send(peer.Take());
        PObject received, copied;
        const int for_a_copy = count([&] { copied = value; });
        EXPECT_LT(count([&] { ASSERT_EQ(PStream().Recv(peer.channel, received), 0); }),
                  for_a_copy + 10);
        EXPECT_EQ(received.toString(), value.toString());
    }
}
