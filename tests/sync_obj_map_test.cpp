#include "tests/support/schedules.h"
#include "tests/support/testing.h"

namespace {

using namespace testing;
using ZEL::PObject;
using ZEL::SyncInfo;
using ZEL::SyncTask;

PObject MapOf(const SyncTask& task) {
    PObject obj;
    ZEL::SyncTask2PObj(task, obj);
    return obj;
}

// The task of a map with these entries.
SyncTask TaskOf(const PObject::Map& entries) {
    PObject obj;
    obj = entries;
    SyncTask task;
    ZEL::PObj2SyncTask(obj, task);
    return task;
}

SyncTask FullTask() {
    return TaskOf(test::FullTask().asMap());
}

template <typename Record>
std::string Dump(const Record& record) {
    std::ostringstream stream;
    stream << record;
    return stream.str();
}

TEST(TaskMap, IsFlatAndBringsEveryFieldBack) {
    const PObject obj = MapOf(FullTask());
    EXPECT_EQ(obj["id"].asUInt64(), UINT64_MAX);
    EXPECT_EQ(
        obj.toString(),
        R"({"block": 0, "compress": 1, "id": 18446744073709551615, "max_bandwidth": 4294967295, )"
        R"("name": "nightly", "period_hour": 1, "period_minute": 30, "pswd": "secret words", )"
        R"("repeat_times_in_day": 3, "rsync_timeout": 900, "schedule_begin_day": 29, )"
        R"("schedule_begin_hour": 8, "schedule_begin_min": 30, "schedule_begin_month": 2, )"
        R"("schedule_begin_year": 2016, "schedule_mode": 4, "server_ip": "10.0.0.5", )"
        R"("server_name": "cellar", "share_list": ["b", "a"], "ssh": 1, "ssh_port": 2222, )"
        R"("user": "lena", "week_schd": "0100010"})");
}

TEST(TaskMap, MissingKeysGiveDefaultsButKeepTheId) {
    for (const PObject& nothing : {PObject(), PObject("text")}) {
        SyncTask task = FullTask();
        ZEL::PObj2SyncTask(nothing, task);
        EXPECT_EQ(task.GetID(), UINT64_MAX);
        EXPECT_EQ(Dump(task.GetInfo()), Dump(ZEL::TaskInfo()));
    }
    SyncInfo info = FullTask().GetInfo().GetSyncInfo();
    PObject user;
    user["user"] = "max";
    ZEL::PObj2SyncInfo(user, info);
    EXPECT_EQ(info.GetUser() + info.GetPassword(), "maxsecret words");

    ZEL::TASK_STATUS status = ZEL::TASK_STATUS_PAUSED;
    ZEL::TASK_RESULT result = ZEL::TASK_RESULT_FAILED;
    SyncTask task;
    user["status"] = -2;
    ZEL::PObj2SyncTask(user, task, status, result);
    EXPECT_EQ(status, -2);
    EXPECT_EQ(result, ZEL::TASK_RESULT_NONE);
}

TEST(TaskMap, WritingKeepsOtherKeysAndWhatIsNotATasksOwn) {
    PObject obj;
    obj["status"] = 2;
    obj["id"] = 7;
    ZEL::TaskInfo2PObj(FullTask().GetInfo(), obj);
    EXPECT_EQ(obj["status"].asInt32() * 10 + obj["id"].asInt32(), 27);
    PObject text("text");
    ZEL::SyncTask2PObj(FullTask(), text);
    EXPECT_EQ(text.toString(), MapOf(FullTask()).toString());
    EXPECT_FALSE(text.hasMember("status") || text.hasMember("sync_result"));
}

TEST(TaskMap, PeriodNeedsBothItsKeysAndFollowsTheRepeatCount) {
    struct {
        PObject::Map entries;
        std::vector<long> repeat_and_period;
    } const cases[] = {
        {{{"repeat_times_in_day", 3}}, {3, 0}},
        {{{"repeat_times_in_day", 3}, {"period_hour", 2}}, {3, 0}},
        {{{"repeat_times_in_day", 3}, {"period_minute", 2}}, {3, 0}},
        {{{"repeat_times_in_day", 3}, {"period_hour", 0}, {"period_minute", 0}}, {0, 0}},
        {{{"repeat_times_in_day", 0}, {"period_hour", 1}, {"period_minute", 1}}, {0, 3660}},
        {{{"repeat_times_in_day", -3}, {"period_hour", 1}, {"period_minute", -1}}, {-3, 3540}},
    };
    for (const auto& c : cases) {
        const ZEL::Schedule schedule = TaskOf(c.entries).GetInfo().GetSchedule();
        EXPECT_THAT(c.repeat_and_period,
                    ElementsAre(schedule.GetRepeatTimesInDay(), schedule.GetPeriodSeconds()));
    }
}

TEST(TaskMap, DropsSecondsOfThePeriodAndUnknownFlagBits) {
    SyncTask task = FullTask();
    task.GetInfo().GetSchedule().SetPeriod(5430);
    SyncInfo info = task.GetInfo().GetSyncInfo();
    info.SetSyncConfigFlag(0x13);
    task.GetInfo().SetSyncInfo(info);
    const SyncTask back = TaskOf(MapOf(task).asMap());
    EXPECT_EQ(back.GetInfo().GetSchedule().GetPeriodSeconds(), 5400);
    EXPECT_EQ(back.GetInfo().GetSyncInfo().GetSyncConfigFlag(), 3U);
}

TEST(TaskMap, ValuesOfOtherTypesComeInAsTheyRead) {
    PObject mixed;
    mixed.asArray() = {1, "b", PObject()};
    const SyncTask task = TaskOf({{"id", "5"},
                                  {"share_list", mixed},
                                  {"user", 5},
                                  {"ssh", "0"},
                                  {"schedule_mode", 0x100000009ULL},
                                  {"week_schd", 1}});
    EXPECT_EQ(task.GetID(), 0U);
    EXPECT_THAT(task.GetInfo().GetShareList(), ElementsAre("1", "b", ""));
    EXPECT_EQ(task.GetInfo().GetSyncInfo().GetUser(), "5");
    EXPECT_TRUE(task.GetInfo().GetSyncInfo().UseSSH());
    EXPECT_EQ(task.GetInfo().GetSchedule().GetMode(), 9U);
    EXPECT_EQ(task.GetInfo().GetSchedule().GetWeekSchedule(), "1111111");
    EXPECT_THAT(TaskOf({{"share_list", "a"}}).GetInfo().GetShareList(), IsEmpty());
}

TEST(Dump, TaskEndsInItsScheduleWithoutALineEndAndTellsNoPassword) {
    EXPECT_EQ(Dump(FullTask()),
              "id: ................... 18446744073709551615\n"
              "\n"
              "name: ................. nightly\n"
              "share_list: ........... b,a,\n"
              "<Server Info>\n"
              "user: ................. lena\n"
              "server_ip: ............ 10.0.0.5\n"
              "server_name: .......... cellar\n"
              "use compression: ...... yes\n"
              "use block level sync: . no\n"
              "use ssh: .............. yes\n"
              "ssh port: ............. 2222\n"
              "max bandwidth: ........ 4294967295\n"
              "rsync timeout: ........ 900\n"
              "<Schedule>\n"
              "mode: ................ yearly\n"
              "week_schd: ............. 0100010\n"
              "schedule_begin: ...... 2016-02-29 08:30:00\n"
              "period: .............. 01:30\n"
              "repeat_times_in_day: . 3\n"
              "last sync in day: .... 13:00");
    EXPECT_THAT(Dump(ZEL::Schedule()), HasSubstr("schedule_begin: ...... 2014-01-01 00:00:00\n"));
}

TEST(Dump, SharesAndEvents) {
    ZEL::Share share;
    share.SetID(7);
    share.SetName("photo");
    EXPECT_EQ(Dump(share), "id: ... 7\nname: . photo\n");
    ZEL::Event event;
    event.SetID(UINT64_MAX);
    event.SetShareName("photo");
    event.SetRelativePath("a");
    event.SetStatus(static_cast<ZEL::EVENT_STATUS>(-1));
    EXPECT_EQ(Dump(event),
              "id: ............ 18446744073709551615\n"
              "share_name: .... photo\n"
              "relative_path: . /a\n"
              "status: ........ -1\n");
}

TEST(Dump, LeavesTheFillAtZeroAndNumbersDecimal) {
    std::ostringstream stream;
    stream << std::hex << std::showpos << FullTask().GetInfo().GetSchedule();
    EXPECT_EQ(stream.fill(), '0');
    EXPECT_EQ(stream.str(), Dump(FullTask().GetInfo().GetSchedule()));
}

TEST(Dump, SchedulesThatAreNotValidDumpToo) {
    ZEL::Schedule schedule;
    schedule.SetRepeatTimesInDay(LONG_MAX);
    schedule.SetPeriod(LONG_MAX);
    schedule.SetBeginYear(INT_MIN);
    schedule.SetBeginMonth(INT_MAX);
    schedule.SetStartHour(-1);
    EXPECT_THAT(Dump(schedule), testing::HasSubstr("-2147481748-2147483647-01 -1:00:00\n"));
}

}  // namespace
