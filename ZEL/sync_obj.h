// What a client keeps of its sync tasks: which shares go to which server, how, and when.
//
// All records are plain copyable values. Setters store what they are given unless they say
// otherwise; Validate() tells whether a record makes sense, and logs the first fault that it finds.
// A record belongs to one thread at a time; different records are independent of each other.
#pragma once

#include <time.h>

#include <cstdint>
#include <iosfwd>
#include <list>
#include <string>

#include "ZEL/pobject.h"

namespace ZEL {

#pragma GCC visibility push(default)

/// When a task runs.
enum SCHD_MODE : uint32_t {
    SCHD_MODE_MANUAL = 0,    ///< only when asked to
    SCHD_MODE_REALTIME = 1,  ///< as soon as something has changed
    SCHD_MODE_WEEKLY = 2,    ///< on the chosen days of the week
    SCHD_MODE_MONTHLY = 3,   ///< on the begin day of each month
    SCHD_MODE_YEARLY = 4,    ///< on the begin month and day of each year
    SCHD_MODE_ONCE = 5       ///< on the begin date alone
};

/// What a task is doing.
enum TASK_STATUS : int32_t {
    TASK_STATUS_IDLE = 0,     ///< nothing to do, or waiting for its next run
    TASK_STATUS_WAITING = 1,  ///< due; waits for its turn
    TASK_STATUS_RUNNING = 2,  ///< runs now
    TASK_STATUS_PAUSED = 3,   ///< not started by the schedule until it is resumed
    TASK_STATUS_CONFIRM = 4   ///< something of it waits until a person allows it
};

/// How a task's last run ended.
enum TASK_RESULT : int32_t {
    TASK_RESULT_NONE = 0,      ///< it has not run yet
    TASK_RESULT_SUCCESS = 1,   ///< every share arrived whole
    TASK_RESULT_FAILED = 2,    ///< something did not arrive
    TASK_RESULT_CANCELLED = 3  ///< stopped by a person
};

/// Where an event is on its way to the server.
enum EVENT_STATUS : int32_t {
    EVENT_STATUS_PENDING = 0,  ///< waits to be sent
    EVENT_STATUS_SENDING = 1   ///< part of a run that has not ended yet
};

/// A shared folder, known by id and name.
class Share {
public:
    uint64_t GetID() const { return id_; }
    std::string GetName() const { return name_; }
    void SetID(uint64_t id) { id_ = id; }
    void SetName(const std::string& name) { name_ = name; }

private:
    uint64_t id_ = 0;
    std::string name_;
};

/// How to reach the server, whom to log in as, and how to run rsync.
class SyncInfo {
public:
    /// The switches as one word: bit 0 compression, bit 1 SSH, bit 2 block-level sync; other bits
    /// are kept as given.
    uint32_t GetSyncConfigFlag() const { return sync_config_flag_; }
    uint32_t GetSSHPort() const { return ssh_port_; }
    /// The bandwidth limit of the transfer in KiB per second; 0: none.
    uint32_t GetMaxBandwidth() const { return max_bandwidth_; }
    /// Seconds without any data after which rsync gives up.
    uint32_t GetRsyncTimeout() const { return rsync_timeout_; }
    std::string GetUser() const { return user_; }
    std::string GetPassword() const { return password_; }
    std::string GetServerIP() const { return server_ip_; }
    std::string GetServerName() const { return server_name_; }

    bool UseCompression() const { return (sync_config_flag_ & kCompression) != 0; }
    bool UseSSH() const { return (sync_config_flag_ & kSSH) != 0; }
    bool UseBlockLevelSync() const { return (sync_config_flag_ & kBlockLevelSync) != 0; }

    /// Replaces the whole word.
    void SetSyncConfigFlag(uint32_t flag) { sync_config_flag_ = flag; }
    void SetSSHPort(uint32_t port) { ssh_port_ = port; }
    void SetMaxBandwidth(uint32_t bandwidth) { max_bandwidth_ = bandwidth; }
    void SetRsyncTimeout(uint32_t seconds) { rsync_timeout_ = seconds; }
    void SetUser(const std::string& user) { user_ = user; }
    void SetPassword(const std::string& password) { password_ = password; }
    void SetServerIP(const std::string& ip) { server_ip_ = ip; }
    void SetServerName(const std::string& name) { server_name_ = name; }

    /// Set or clear their own bit of the word alone.
    void SetCompression(bool on) { SetBit(kCompression, on); }
    void SetSSH(bool on) { SetBit(kSSH, on); }
    void SetBlockLevelSync(bool on) { SetBit(kBlockLevelSync, on); }

    /// True when there is an address or a name, a user, an SSH port below 65536 (0 passes; looked
    /// at even when SSH is off) and a time-out from 600 to 86400 seconds. Nothing else is looked
    /// at.
    bool Validate() const;

private:
    enum Bit : uint32_t { kCompression = 1, kSSH = 2, kBlockLevelSync = 4 };

    void SetBit(Bit bit, bool on) {
        sync_config_flag_ = on ? sync_config_flag_ | bit : sync_config_flag_ & ~uint32_t{bit};
    }

    uint32_t sync_config_flag_ = 0;
    uint32_t ssh_port_ = 0;
    uint32_t max_bandwidth_ = 0;
    uint32_t rsync_timeout_ = 600;
    std::string user_;
    std::string password_;
    std::string server_ip_;
    std::string server_name_;
};

/// The days and the times of day at which a task runs, in the process's local time zone.
///
/// On each of its days a task runs at the start time, and then as often again as the repeat count
/// says, one period apart. Setters do not check ranges: Validate() does.
class Schedule {
public:
    SCHD_MODE GetMode() const { return mode_; }
    /// Seconds between the runs of one day.
    long GetPeriodSeconds() const { return period_; }
    /// Runs of one day after the first.
    long GetRepeatTimesInDay() const { return repeat_times_in_day_; }
    /// Seven characters, from Sunday to Saturday; '1' for a chosen day, '0' for another.
    std::string GetWeekSchedule() const { return week_schedule_; }
    int GetBeginYear() const { return begin_year_; }
    int GetBeginMonth() const { return begin_month_; }
    int GetBeginDay() const { return begin_day_; }
    int GetStartHour() const { return start_hour_; }
    int GetStartMinute() const { return start_minute_; }

    void SetMode(SCHD_MODE mode) { mode_ = mode; }
    /// The calendar year, with its century.
    void SetBeginYear(int year) { begin_year_ = year; }
    /// 1 to 12.
    void SetBeginMonth(int month) { begin_month_ = month; }
    /// 1 to 31.
    void SetBeginDay(int day) { begin_day_ = day; }
    /// 0 to 23.
    void SetStartHour(int hour) { start_hour_ = hour; }
    /// 0 to 59.
    void SetStartMinute(int minute) { start_minute_ = minute; }

    /// "manual", "realtime", "weekly", "monthly", "yearly" or "once"; "weekly" for a mode that is
    /// none.
    std::string GetModeStr() const;
    /// The reverse, by the exact text. Any other text means manual.
    void SetModeByStr(const std::string& mode);

    /// The period's whole hours, and the whole minutes beyond them.
    long GetPeriodHourPart() const { return period_ / 3600; }
    long GetPeriodMinutePart() const { return period_ / 60 % 60; }
    /// A period of 0 takes the repeat count to 0 as well. Hours and minutes that make more seconds
    /// than a long holds give the nearest that it does hold.
    void SetPeriod(long seconds);
    void SetPeriod(long hours, long minutes);
    /// A count of 0 takes the period to 0 as well.
    void SetRepeatTimesInDay(long times);

    /// Takes the first seven characters: '0' stays, any other becomes '1'. Fewer than seven
    /// characters, or seven times '0', choose every day.
    void SetWeekSchedule(const std::string& week);

    /// The begin date and the start time as they were set, everything else 0.
    struct tm GetScheduleBegin() const;

    /// True when the start is a time of day, the period less than a day, the repeat count at most
    /// 95, the last run on the same day as the first, the begin date a date since 1970, and mode
    /// and week are what they can be.
    bool Validate() const;

    /// The time of the first run after `reference`, both in seconds since the epoch; `reference` +
    /// 1 in realtime mode; 0 when no run will come (manual, or once and over); -1 on failure: a
    /// negative reference, or a time that cannot be computed.
    ///
    /// A run at exactly `reference` is not returned. A day that a month does not have carries over
    /// into the next month: the 31st of April is the 1st of May. For schedules that pass
    /// Validate(); with any other the call ends too, but may give -1. The daylight-saving state
    /// that the search comes from is kept where mktime() does not settle it, so a run on the day of
    /// a change can move by the change. Call tzset() after changing the zone of a running process.
    long GetNextScheduledSeconds(long reference) const;

private:
    SCHD_MODE mode_ = SCHD_MODE_MANUAL;
    long period_ = 0;
    long repeat_times_in_day_ = 0;
    std::string week_schedule_ = "1111111";
    int begin_year_ = 2014;
    int begin_month_ = 1;
    int begin_day_ = 1;
    int start_hour_ = 0;
    int start_minute_ = 0;
};

/// How many days after `weekday` (0 is Sunday) the first chosen day of `week` comes: 0 to 6, or -1
/// when none is chosen. Only '1' chooses here.
int GetDaysToNextSync(unsigned int weekday, const std::string& week);

/// A task: its shares, where they go, and when.
class TaskInfo {
public:
    std::string GetName() const { return name_; }
    /// Names of shares, in the order in which they are synced.
    const std::list<std::string>& GetShareList() const { return share_list_; }
    const SyncInfo& GetSyncInfo() const { return sync_info_; }
    const Schedule& GetSchedule() const { return schedule_; }
    Schedule& GetSchedule() { return schedule_; }

    void SetName(const std::string& name) { name_ = name; }
    void SetShareList(const std::list<std::string>& shares) { share_list_ = shares; }
    void SetSyncInfo(const SyncInfo& info) { sync_info_ = info; }
    void SetSchedule(const Schedule& schedule) { schedule_ = schedule; }

    /// True when sync info and schedule are valid, name and share list are not empty and every
    /// share may be synced (IsValidShare in zel.h). The shares are looked up on this host, in
    /// order, up to the first that may not.
    bool Validate() const;

private:
    std::string name_;
    std::list<std::string> share_list_;
    SyncInfo sync_info_;
    Schedule schedule_;
};

/// A task as it is stored: with its id.
class SyncTask {
public:
    uint64_t GetID() const { return id_; }
    const TaskInfo& GetInfo() const { return info_; }
    TaskInfo& GetInfo() { return info_; }
    void SetID(uint64_t id) { id_ = id; }
    void SetInfo(const TaskInfo& info) { info_ = info; }

private:
    uint64_t id_ = 0;
    TaskInfo info_;
};

/// A change somewhere below a share that has not reached the server yet.
class Event {
public:
    EVENT_STATUS GetStatus() const { return status_; }
    uint64_t GetID() const { return id_; }
    std::string GetShareName() const { return share_name_; }
    /// The path below the share's folder; begins with "/" once it has been set.
    std::string GetRelativePath() const { return relative_path_; }

    void SetStatus(EVENT_STATUS status) { status_ = status; }
    void SetID(uint64_t id) { id_ = id; }
    void SetShareName(const std::string& name) { share_name_ = name; }
    /// Puts a "/" in front of a path that does not begin with one. Nothing else is changed.
    void SetRelativePath(const std::string& path);

private:
    EVENT_STATUS status_ = EVENT_STATUS_PENDING;
    uint64_t id_ = 0;
    std::string share_name_;
    std::string relative_path_;
};

// Tasks as one flat PObject map, with the fields of sync info and schedule beside the task's own:
//
//   id, name, share_list (an array of strings),
//   user, pswd, server_ip, server_name, compress, block, ssh (0 or 1), ssh_port, max_bandwidth,
//   rsync_timeout,
//   schedule_mode (the number), week_schd, repeat_times_in_day, period_hour, period_minute,
//   schedule_begin_year, _month, _day, _hour, _min.
//
// The period's seconds beyond whole minutes, and flag bits other than the three switches, do not
// travel. Nothing is checked on the way: values of another type come in as PObject's reads give
// them, and Validate() judges the outcome.

/// Sets the fields that the map has keys for, and leaves the others as they are.
void PObj2SyncInfo(const PObject& obj, SyncInfo& info);

/// Replaces the task's info whole: a field without a key gets its default. The id alone stays as it
/// was without its key. The period needs both of its keys; one alone is not looked at. It is set
/// after the repeat count: no period, no repeats.
void PObj2SyncTask(const PObject& obj, SyncTask& task);
/// The same, with what travels beside a task: "status" and "sync_result", 0 where they are missing.
void PObj2SyncTask(const PObject& obj, SyncTask& task, TASK_STATUS& status, TASK_RESULT& result);

/// Writes every key but the id. Other keys of `obj` stay; what is no map becomes one.
void TaskInfo2PObj(const TaskInfo& info, PObject& obj);
/// The same with the id. Whoever sends "status" and "sync_result" sets them beside it.
void SyncTask2PObj(const SyncTask& task, PObject& obj);

// For logs and people: a label and a value a line, every line ended and flushed, except that a
// schedule, and with it what ends in one, stops after its last value. The password is never
// written.

std::ostream& operator<<(std::ostream& stream, const Share& share);
std::ostream& operator<<(std::ostream& stream, const Event& event);
std::ostream& operator<<(std::ostream& stream, const SyncInfo& info);
/// Leaves the stream's fill character at '0'.
std::ostream& operator<<(std::ostream& stream, const Schedule& schedule);
/// Leaves the stream's fill character at '0'.
std::ostream& operator<<(std::ostream& stream, const TaskInfo& info);
/// Leaves the stream's fill character at '0'.
std::ostream& operator<<(std::ostream& stream, const SyncTask& task);

#pragma GCC visibility pop

}  // namespace ZEL
