// The library against a decoder and encoder of the wire format in another language.

#include "ZEL/ipc.h"
#include "ZEL/stream.h"
#include "tests/integration/command.h"
#include "tests/support/sockets.h"
#include "tests/support/testing.h"

using ZEL::PObject;

namespace {

const std::string kPeer = "python3 " TESTS_FOLDER "/integration/wire_peer.py ";
constexpr char kDocument[] = TESTS_FOLDER "/../docs/wire-format.md";

}  // namespace

TEST(Wire, TheDocumentsExampleIsWhatTheLibrarySends) {
    std::istringstream output(test::Run(kPeer + "document " + kDocument));
    std::string hex, text;
    std::getline(output, hex);
    std::getline(output, text);
    test::RawPeer peer;
    peer.Send(test::Unhex(hex));
    PObject value;
    ASSERT_EQ(ZEL::PStream().Recv(peer.channel, value), 0);
    EXPECT_EQ(value.toString(), text);
    ASSERT_EQ(ZEL::PStream().Send(peer.channel, value), 0);
    EXPECT_EQ(test::Hex(peer.Take()), hex);
}

TEST(Wire, AnotherLanguageReadsAndWritesTheSameValues) {
    const test::TempFolder folder;
    ZEL::IPCListener listener;
    ASSERT_EQ(listener.prepare(folder.Path("socket")), 0);
    test::Command python(kPeer + "echo " + folder.Path("socket"));
    ZEL::IPCSender sender;
    ASSERT_EQ(sender.assign(listener.accept()), 0);

    PObject integers;
    for (int bits = 0; bits < 64; ++bits) {
        integers.asArray().push_back((1ULL << bits) - 1);
        integers.asArray().push_back(1ULL << bits);
    }
    PObject task;
    task["share_list"].asArray().push_back("photo");
    task["share_list"].asArray().push_back("");
    task["nothing"];
    task["empty"].asMap();
    task["integers"] = integers;
    task["note"] = std::string(65535, 'n');
    PObject bulk;
    for (int i = 0; i < 200; ++i) {
        bulk[std::string(300, 'k') + std::to_string(i)] = task["share_list"];
    }
    for (const PObject& value : {PObject(), PObject("text"), integers, task, bulk}) {
        PObject reply;
        ASSERT_EQ(sender.send(value, true, reply), 0);
        EXPECT_EQ(python.ReadLine(), value.toString());
        EXPECT_EQ(reply.toString(), value.toString());
    }
    sender.close();
    int status = 1;
    EXPECT_EQ(python.Finish(status), "");
    EXPECT_EQ(status, 0);
}
