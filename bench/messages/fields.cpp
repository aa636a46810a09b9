#include "bench/messages/contests.h"

namespace bench {

const std::vector<Field>& TaskFields() {
    static const std::vector<Field> fields = {
        {"id", 42, {}},
        {"name", 0, {"nightly copy of the photographs"}},
        {"share_list", 0, {"photo", "music", "home"}},
        {"user", 0, {"admin"}},
        {"pswd", 0, {"correct horse battery staple"}},
        {"server_ip", 0, {"192.168.178.21"}},
        {"server_name", 0, {"backup-nas"}},
        {"compress", 1, {}},
        {"block", 1, {}},
        {"ssh", 1, {}},
        {"ssh_port", 22, {}},
        {"max_bandwidth", 20480, {}},
        {"rsync_timeout", 600, {}},
        {"schedule_mode", 2, {}},
        {"week_schd", 0x7f, {}},
        {"repeat_times_in_day", 4, {}},
        {"period_hour", 6, {}},
        {"period_minute", 0, {}},
        {"schedule_begin_year", 2024, {}},
        {"schedule_begin_month", 11, {}},
        {"schedule_begin_day", 30, {}},
        {"schedule_begin_hour", 1, {}},
        {"schedule_begin_min", 15, {}},
    };
    return fields;
}

ZEL::PObject ToObject(const std::vector<Field>& fields) {
    ZEL::PObject object;
    for (const Field& field : fields) {
        ZEL::PObject& value = object[field.key];
        if (field.IsList()) {
            value.asArray().assign(field.texts.begin(), field.texts.end());
        } else if (field.IsText()) {
            value = field.texts[0];
        } else {
            value = field.number;
        }
    }
    return object;
}

size_t WireSize(const ZEL::PObject& message) {
    const Connection connection;
    {
        ZEL::IPCSender sender;
        Require(sender.assign(connection.fds[0]) == 0 && sender.send(message) == 0, "send");
    }
    size_t size = 0;
    char buffer[4096];
    for (ssize_t n; (n = recv(connection.fds[1], buffer, sizeof buffer, 0)) > 0;) {
        size += static_cast<size_t>(n);
    }
    close(connection.fds[1]);
    return size;
}

}  // namespace bench
