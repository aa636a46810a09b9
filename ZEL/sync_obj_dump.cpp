// The records of sync_obj.h as text. Labels are padded with a dot leader, to a width of its own for
// each record.
#include <iomanip>
#include <ostream>

#include "ZEL/sync_obj.h"

namespace ZEL {

namespace {

// Numbers are formatted here: decimal, whatever base, sign or grouping the stream is set to.
struct TwoWide {
    int64_t number;
};

std::ostream& operator<<(std::ostream& stream, TwoWide value) {
    return stream << std::setw(2) << std::setfill('0') << std::to_string(value.number);
}

struct HourAndMinute {
    int64_t seconds;
};

std::ostream& operator<<(std::ostream& stream, HourAndMinute time) {
    return stream << TwoWide{time.seconds / 3600} << ":" << TwoWide{time.seconds % 3600 / 60};
}

// Of the day. Only the numbers of a schedule that does not pass Validate() can be too large; the
// result is then cut to 64 bits.
int64_t LastRunSeconds(const Schedule& schedule) {
    const int64_t start = (int64_t{schedule.GetStartHour()} * 60 + schedule.GetStartMinute()) * 60;
    int64_t repeats = 0;
    int64_t last = 0;
    static_cast<void>(__builtin_mul_overflow(schedule.GetPeriodSeconds(),
                                             schedule.GetRepeatTimesInDay(), &repeats));
    static_cast<void>(__builtin_add_overflow(start, repeats, &last));
    return last;
}

const char* YesOrNo(bool value) {
    return value ? "yes" : "no";
}

}  // namespace

std::ostream& operator<<(std::ostream& stream, const Share& share) {
    return stream << "id: ... " << std::to_string(share.GetID()) << std::endl
                  << "name: . " << share.GetName() << std::endl;
}

std::ostream& operator<<(std::ostream& stream, const Event& event) {
    return stream << "id: ............ " << std::to_string(event.GetID()) << std::endl
                  << "share_name: .... " << event.GetShareName() << std::endl
                  << "relative_path: . " << event.GetRelativePath() << std::endl
                  << "status: ........ " << std::to_string(event.GetStatus()) << std::endl;
}

std::ostream& operator<<(std::ostream& stream, const SyncInfo& info) {
    return stream << "user: ................. " << info.GetUser() << std::endl
                  << "server_ip: ............ " << info.GetServerIP() << std::endl
                  << "server_name: .......... " << info.GetServerName() << std::endl
                  << "use compression: ...... " << YesOrNo(info.UseCompression()) << std::endl
                  << "use block level sync: . " << YesOrNo(info.UseBlockLevelSync()) << std::endl
                  << "use ssh: .............. " << YesOrNo(info.UseSSH()) << std::endl
                  << "ssh port: ............. " << std::to_string(info.GetSSHPort()) << std::endl
                  << "max bandwidth: ........ " << std::to_string(info.GetMaxBandwidth())
                  << std::endl
                  << "rsync timeout: ........ " << std::to_string(info.GetRsyncTimeout())
                  << std::endl;
}

std::ostream& operator<<(std::ostream& stream, const Schedule& schedule) {
    const struct tm begin = schedule.GetScheduleBegin();
    // The week's label is two wider than the others, and no line end follows the last value:
    // programs that parse dumps rely on both.
    return stream << "mode: ................ " << schedule.GetModeStr() << std::endl
                  << "week_schd: ............. " << schedule.GetWeekSchedule() << std::endl
                  << "schedule_begin: ...... " << std::to_string(int64_t{begin.tm_year} + 1900)
                  << "-" << TwoWide{int64_t{begin.tm_mon} + 1} << "-" << TwoWide{begin.tm_mday}
                  << " " << TwoWide{begin.tm_hour} << ":" << TwoWide{begin.tm_min} << ":"
                  << TwoWide{begin.tm_sec} << std::endl
                  << "period: .............. " << HourAndMinute{schedule.GetPeriodSeconds()}
                  << std::endl
                  << "repeat_times_in_day: . " << std::to_string(schedule.GetRepeatTimesInDay())
                  << std::endl
                  << "last sync in day: .... " << HourAndMinute{LastRunSeconds(schedule)};
}

std::ostream& operator<<(std::ostream& stream, const TaskInfo& info) {
    stream << "name: ................. " << info.GetName() << std::endl
           << "share_list: ........... ";
    for (const std::string& share : info.GetShareList()) {
        stream << share << ",";
    }
    return stream << std::endl
                  << "<Server Info>" << std::endl
                  << info.GetSyncInfo() << "<Schedule>" << std::endl
                  << info.GetSchedule();
}

std::ostream& operator<<(std::ostream& stream, const SyncTask& task) {
    return stream << "id: ................... " << std::to_string(task.GetID()) << std::endl
                  << std::endl
                  << task.GetInfo();
}

}  // namespace ZEL
