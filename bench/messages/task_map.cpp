// One thread encodes and sends the task map and decodes it at the other end, so that no thread's
// waking is measured.
#include <cstdio>
#include <map>
#include <msgpack.hpp>

#include "ZEL/channel.h"
#include "ZEL/stream.h"
#include "bench/messages/contests.h"

namespace bench {

namespace {

using ZEL::PObject;
using MsgpackMap = std::map<std::string, msgpack::type::variant>;

constexpr int kMessages = 20000;  // a round

MsgpackMap ToMsgpack(const std::vector<Field>& fields) {
    MsgpackMap map;
    for (const Field& field : fields) {
        if (field.IsList()) {
            map[field.key] =
                std::vector<msgpack::type::variant>(field.texts.begin(), field.texts.end());
        } else if (field.IsText()) {
            map[field.key] = field.texts[0];
        } else {
            map[field.key] = uint64_t{field.number};
        }
    }
    return map;
}

class MsgpackPair {
public:
    explicit MsgpackPair(const Connection& connection)
        : near_(connection.fds[0]), far_(connection.fds[1]), far_fd_(connection.fds[1]) {}
    void Send(const MsgpackMap& map) {
        buffer_.clear();
        msgpack::pack(buffer_, map);
        near_.Send(buffer_.data(), buffer_.size());
    }
    void Recv(MsgpackMap& map) {
        msgpack::object_handle handle;
        while (!unpacker_.next(handle)) {
            unpacker_.reserve_buffer(kCapacity);
            const ssize_t count = recv(far_fd_, unpacker_.buffer(), unpacker_.buffer_capacity(), 0);
            Require(count > 0, "recv");
            unpacker_.buffer_consumed(static_cast<size_t>(count));
        }
        handle.get().convert(map);
    }

private:
    BareSocket near_;
    BareSocket far_;
    int far_fd_;
    msgpack::sbuffer buffer_;
    msgpack::unpacker unpacker_;
};

class OurPair {
public:
    explicit OurPair(const Connection& connection) {
        Require(near_.Open(connection.fds[0], true) == 0, "open");
        Require(far_.Open(connection.fds[1], true) == 0, "open");
    }
    void Send(const PObject& map) {
        ZEL::PStream stream;
        Require(stream.Send(near_, map) == 0, "send");
    }
    void Recv(PObject& map) {
        ZEL::PStream stream;
        Require(stream.Recv(far_, map) == 0, "recv");
    }

private:
    ZEL::Channel near_{kCapacity};
    ZEL::Channel far_{kCapacity};
};

// The microseconds that a message takes from value to value.
template <typename Map, typename Pair>
double Transfer(Pair& pair, const Map& map) {
    return Seconds([&] {
               for (int i = 0; i < kMessages; ++i) {
                   Map received;
                   pair.Send(map);
                   pair.Recv(received);
               }
           }) /
           kMessages * 1e6;
}

template <typename Work>
size_t AllocationsOf(const Work& work) {
    const size_t before = Allocations();
    work();
    return Allocations() - before;
}

template <typename Map, typename Pair>
void PrintAllocations(const char* name, Pair& pair, const Map& map) {
    Map copy;
    Map received;
    const size_t value = AllocationsOf([&] { copy = map; });
    const size_t sending = AllocationsOf([&] { pair.Send(map); });
    const size_t receiving = AllocationsOf([&] { pair.Recv(received); });
    printf("allocations of %s: sending %zu, receiving %zu; a copy of the value %zu\n", name,
           sending, receiving, value);
}

}  // namespace

void CompareTaskMap() {
    const PObject map = ToObject(TaskFields());
    const MsgpackMap msgpack_map = ToMsgpack(TaskFields());
    const Connection our_connection;
    OurPair our_pair(our_connection);
    const Connection msgpack_connection;
    MsgpackPair msgpack_pair(msgpack_connection);
    Compare(
        {"task map, value to value", "msgpack-cxx", "us", Contest::kLowIsGood, 1.0},
        [&] { return Transfer(our_pair, map); },
        [&] { return Transfer(msgpack_pair, msgpack_map); });
    PrintAllocations("the task map, ours", our_pair, map);
    // 59 are the value's own; the copy keeps a list of the containers to be copied besides.
    printf(
        "  the value: 1 map, 23 entries, 6 keys above 15 characters, 17 integers, 8 strings, 2 "
        "texts above 15 characters, 1 array, 1 array's elements\n"
        "  receiving: the value, its array with room for more elements\n");
    PrintAllocations("the task map, msgpack-cxx", msgpack_pair, msgpack_map);
}

}  // namespace bench
