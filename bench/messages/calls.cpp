// Requests and replies over a held unix connection between two threads, and streams of messages one
// way.
//
// The bare peer moves the same number of bytes with blocking send() and recv(), a call a message
// where it fits. The sd-bus peer carries the same fields as a{sv} in method calls over a private
// bus: the two ends of a socket pair, without a broker (sd_bus_set_fd, sd_bus_set_server).
#include <sched.h>
#include <systemd/sd-bus.h>

#include <algorithm>
#include <functional>
#include <thread>

#include "bench/messages/contests.h"

namespace bench {

namespace {

using ZEL::PObject;

const std::vector<Field> kReply = {{"status", 0, {}}, {"task_id", 42, {}}};

// On which processors the two sides run. Left to itself a pair of threads shares one or uses two as
// it happens, and a call that wakes another processor costs many times one that does not: so this
// is measured, too, with the choice taken away.
struct Place {
    const char* name;
    int near;
    int far;
};

constexpr int kAnywhere = -1;

// Keeps this thread on a processor.
void StayOn(int processor) {
    cpu_set_t set;
    CPU_ZERO(&set);
    for (int i = 0; i < CPU_SETSIZE; ++i) {
        if (processor == kAnywhere || processor == i) {
            CPU_SET(i, &set);
        }
    }
    Require(sched_setaffinity(0, sizeof set, &set) == 0, "sched_setaffinity");
}

// Anywhere, one processor for both sides and, when this thread may use a second, one for each.
std::vector<Place> Places() {
    cpu_set_t set;
    Require(sched_getaffinity(0, sizeof set, &set) == 0, "sched_getaffinity");
    std::vector<int> processors;
    for (int i = 0; i < CPU_SETSIZE; ++i) {
        if (CPU_ISSET(i, &set)) {
            processors.push_back(i);
        }
    }
    const int first = processors.front();
    std::vector<Place> places = {{"anywhere", kAnywhere, kAnywhere},
                                 {"one processor", first, first}};
    if (processors.size() > 1) {
        places.push_back({"two processors", first, processors[1]});
    }
    return places;
}

// The microseconds of one `step` of many, while another thread runs `other` as often.
double MicrosecondsEach(const Place& place, int count, const std::function<void()>& step,
                        const std::function<void()>& other) {
    StayOn(place.near);
    return Seconds([&] {
               std::thread far([&] {
                   StayOn(place.far);
                   for (int i = 0; i < count; ++i) {
                       other();
                   }
               });
               for (int i = 0; i < count; ++i) {
                   step();
               }
               far.join();
           }) /
           count * 1e6;
}

struct OurEnds {
    OurEnds() {
        const Connection connection;
        Require(near.assign(connection.fds[0]) == 0, "assign");
        Require(far.assign(connection.fds[1]) == 0, "assign");
    }
    ZEL::IPCSender near;
    ZEL::IPCSender far;
};

double OurCalls(const Place& place, OurEnds& ends, int count, const PObject& request,
                const PObject& reply) {
    return MicrosecondsEach(
        place, count,
        [&] {
            PObject answer;
            Require(ends.near.send(request, true, answer) == 0, "send");
        },
        [&] {
            PObject question;
            Require(ends.far.recv(question) == 0, "recv");
            Require(ends.far.send(reply) == 0, "send");
        });
}

double OurMessages(const Place& place, OurEnds& ends, int count, const PObject& message) {
    return MicrosecondsEach(
        place, count, [&] { Require(ends.near.send(message) == 0, "send"); },
        [&] {
            PObject received;
            Require(ends.far.recv(received) == 0, "recv");
        });
}

struct BareEnds {
    explicit BareEnds(const Connection& connection)
        : near(connection.fds[0]), far(connection.fds[1]) {}
    BareSocket near;
    BareSocket far;
};

double BareCalls(const Place& place, BareEnds& ends, int count, size_t request, size_t reply) {
    std::string near(std::max(request, reply), 'x');
    std::string far = near;
    return MicrosecondsEach(
        place, count,
        [&] {
            ends.near.Send(near.data(), request);
            ends.near.Recv(near.data(), reply);
        },
        [&] {
            ends.far.Recv(far.data(), request);
            ends.far.Send(far.data(), reply);
        });
}

double BareMessages(const Place& place, BareEnds& ends, int count, size_t size) {
    std::string near(size, 'x');
    std::string far(size, 'x');
    return MicrosecondsEach(
        place, count, [&] { ends.near.Send(near.data(), size); },
        [&] { ends.far.Recv(far.data(), size); });
}

void AppendFields(sd_bus_message* message, const std::vector<Field>& fields) {
    int result = sd_bus_message_open_container(message, 'a', "{sv}");
    for (const Field& field : fields) {
        if (field.IsList()) {
            std::vector<char*> texts;
            for (const std::string& text : field.texts) {
                texts.push_back(const_cast<char*>(text.c_str()));
            }
            texts.push_back(nullptr);
            result |= sd_bus_message_open_container(message, 'e', "sv");
            result |= sd_bus_message_append(message, "s", field.key);
            result |= sd_bus_message_open_container(message, 'v', "as");
            result |= sd_bus_message_append_strv(message, texts.data());
            result |= sd_bus_message_close_container(message);
            result |= sd_bus_message_close_container(message);
        } else if (field.IsText()) {
            result |=
                sd_bus_message_append(message, "{sv}", field.key, "s", field.texts[0].c_str());
        } else {
            result |=
                sd_bus_message_append(message, "{sv}", field.key, "t", uint64_t{field.number});
        }
    }
    result |= sd_bus_message_close_container(message);
    Require(result >= 0, "sd_bus_message_append");
}

// Into values of our own kind: what is compared is how they came.
void ReadFields(sd_bus_message* message, PObject& fields) {
    sd_bus_message_enter_container(message, 'a', "{sv}");
    while (sd_bus_message_enter_container(message, 'e', "sv") > 0) {
        const char* key = nullptr;
        const char* contents = nullptr;
        sd_bus_message_read(message, "s", &key);
        sd_bus_message_peek_type(message, nullptr, &contents);
        sd_bus_message_enter_container(message, 'v', contents);
        PObject& value = fields[key];
        const char* text = nullptr;
        uint64_t number = 0;
        if (contents[0] == 't') {
            sd_bus_message_read(message, "t", &number);
            value = number;
        } else if (contents[0] == 's') {
            sd_bus_message_read(message, "s", &text);
            value = text;
        } else {
            sd_bus_message_enter_container(message, 'a', "s");
            while (sd_bus_message_read(message, "s", &text) > 0) {
                value.asArray().emplace_back(text);
            }
            sd_bus_message_exit_container(message);
        }
        sd_bus_message_exit_container(message);
        sd_bus_message_exit_container(message);
    }
    sd_bus_message_exit_container(message);
}

// A server thread for as long as the object lives, and the client's end.
class BusPair {
public:
    BusPair(const Place& place, const std::vector<Field>& reply) : reply_(reply) {
        const Connection connection;
        server_ = std::thread([this, place, fd = connection.fds[1]] {
            StayOn(place.far);
            Serve(fd);
        });
        Require(sd_bus_new(&client_) >= 0, "sd_bus_new");
        Require(sd_bus_set_fd(client_, connection.fds[0], connection.fds[0]) >= 0, "sd_bus_set_fd");
        Require(sd_bus_start(client_) >= 0, "sd_bus_start");
    }
    ~BusPair() {
        sd_bus_flush_close_unref(client_);
        server_.join();
    }
    BusPair(const BusPair&) = delete;
    BusPair& operator=(const BusPair&) = delete;

    double Calls(int count, const std::vector<Field>& request) {
        return Seconds([&] {
                   for (int i = 0; i < count; ++i) {
                       Call(request);
                   }
               }) /
               count * 1e6;
    }

private:
    void Call(const std::vector<Field>& request) {
        sd_bus_message* call = nullptr;
        sd_bus_message* answer = nullptr;
        Require(sd_bus_message_new_method_call(client_, &call, nullptr, "/task", "bench.Task",
                                               "Run") >= 0,
                "sd_bus_message_new_method_call");
        AppendFields(call, request);
        Require(sd_bus_call(client_, call, 0, nullptr, &answer) >= 0, "sd_bus_call");
        PObject fields;
        ReadFields(answer, fields);
        Require(!fields.isEmpty(), "reading the answer");
        sd_bus_message_unref(answer);
        sd_bus_message_unref(call);
    }

    void Serve(int fd) {
        sd_bus* bus = nullptr;
        sd_id128_t id = {};
        Require(sd_bus_new(&bus) >= 0 && sd_bus_set_fd(bus, fd, fd) >= 0 &&
                    sd_bus_set_server(bus, 1, id) >= 0 &&
                    sd_bus_add_filter(bus, nullptr, Answer, this) >= 0 && sd_bus_start(bus) >= 0,
                "sd_bus_start of the server");
        for (int processed = 0; processed >= 0;) {
            processed = sd_bus_process(bus, nullptr);
            if (processed == 0) {
                processed = sd_bus_wait(bus, UINT64_MAX);
            }
        }
        sd_bus_unref(bus);
    }

    static int Answer(sd_bus_message* call, void* self, sd_bus_error*) {
        if (sd_bus_message_is_method_call(call, "bench.Task", "Run") <= 0) {
            return 0;
        }
        PObject fields;
        ReadFields(call, fields);
        Require(!fields.isEmpty(), "reading the call");
        sd_bus_message* answer = nullptr;
        Require(sd_bus_message_new_method_return(call, &answer) >= 0, "a return");
        AppendFields(answer, static_cast<BusPair*>(self)->reply_);
        Require(sd_bus_send(nullptr, answer, nullptr) >= 0, "sd_bus_send");
        sd_bus_message_unref(answer);
        return 1;
    }

    const std::vector<Field>& reply_;
    std::thread server_;
    sd_bus* client_ = nullptr;
};

void CompareCall(const Place& place, const char* content, const std::vector<Field>& fields) {
    constexpr int kCalls = 3000;
    const PObject request = ToObject(fields);
    const PObject reply = ToObject(kReply);
    const size_t request_size = WireSize(request);
    const size_t reply_size = WireSize(reply);
    const std::string name = std::string(content) + ", " + place.name;
    StayOn(place.near);
    OurEnds ours;
    BareEnds bare{Connection()};
    BusPair bus(place, kReply);
    const auto our_calls = [&] { return OurCalls(place, ours, kCalls, request, reply); };
    Compare({name.c_str(), "bare send/recv", "us", Contest::kLowIsGood, 1.3}, our_calls,
            [&] { return BareCalls(place, bare, kCalls, request_size, reply_size); });
    Compare({name.c_str(), "sd-bus, socket pair", "us", Contest::kLowIsGood, 0.5}, our_calls,
            [&] { return bus.Calls(kCalls, fields); });
}

void CompareOneWay(const Place& place, const char* content, int count, const PObject& message) {
    const size_t size = WireSize(message);
    const std::string name = std::string(content) + ", " + place.name;
    OurEnds ours;
    BareEnds bare{Connection()};
    Compare(
        {name.c_str(), "bare send/recv", "us", Contest::kLowIsGood, 0},
        [&] { return OurMessages(place, ours, count, message); },
        [&] { return BareMessages(place, bare, count, size); });
}

}  // namespace

void CompareCalls() {
    const std::vector<Field> request = {{"action", 0, {"run"}},
                                        {"task_id", 42, {}},
                                        {"share_list", 0, {"photo", "music", "home"}},
                                        {"limit", 1048576, {}}};
    PObject table;
    for (unsigned long long i = 0; i < 500; ++i) {
        table.asArray().push_back(ToObject({{"id", i, {}},
                                            {"name", 0, {"a share's name of middling length"}},
                                            {"bytes", 1234567 * i, {}}}));
    }
    cpu_set_t before;
    Require(sched_getaffinity(0, sizeof before, &before) == 0, "sched_getaffinity");
    for (const Place& place : Places()) {
        CompareCall(place, "call, 4 keys", request);
        CompareCall(place, "call, 23 keys", TaskFields());
        CompareOneWay(place, "4 keys one way", 20000, ToObject(request));
        CompareOneWay(place, "500 rows one way", 200, table);
    }
    sched_setaffinity(0, sizeof before, &before);
}

}  // namespace bench
