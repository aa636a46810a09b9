#include "programs/zel_daemon/store_schema.h"

#include <algorithm>
#include <string>

#include "programs/common/failure.h"
#include "programs/common/task_fields.h"

namespace zel_daemon {

namespace {

using programs::Failure;
using programs::FailureKind;

// Marks the file as a store ("ZELd"), so that no other program's database is ever written to.
constexpr int64_t kApplicationId = 0x5a454c64;

// Columns of tasks are named like the keys of TaskFields(). Lists are JSON arrays. Ids are never
// used again: a late answer about what is gone meets nothing.
constexpr char kFirst[] = R"(
CREATE TABLE tasks (
    id INTEGER PRIMARY KEY AUTOINCREMENT,
    name TEXT NOT NULL UNIQUE,
    share_list TEXT NOT NULL,
    user TEXT NOT NULL,
    pswd TEXT NOT NULL,
    server_ip TEXT NOT NULL,
    server_name TEXT NOT NULL,
    compress INTEGER NOT NULL,
    block INTEGER NOT NULL,
    ssh INTEGER NOT NULL,
    ssh_port INTEGER NOT NULL,
    max_bandwidth INTEGER NOT NULL,
    rsync_timeout INTEGER NOT NULL,
    schedule_mode INTEGER NOT NULL,        -- 0 manual, 1 realtime, 2 weekly, 3 monthly, 4 yearly, 5 once
    week_schd TEXT NOT NULL,               -- from Sunday to Saturday
    repeat_times_in_day INTEGER NOT NULL,
    period_hour INTEGER NOT NULL,
    period_minute INTEGER NOT NULL,
    schedule_begin_year INTEGER NOT NULL,
    schedule_begin_month INTEGER NOT NULL,
    schedule_begin_day INTEGER NOT NULL,
    schedule_begin_hour INTEGER NOT NULL,
    schedule_begin_min INTEGER NOT NULL,
    exclude TEXT NOT NULL,
    paused INTEGER NOT NULL,
    checked_until INTEGER NOT NULL,        -- seconds since the epoch
    whole_due INTEGER NOT NULL
);
CREATE TABLE events (
    id INTEGER PRIMARY KEY AUTOINCREMENT,
    task INTEGER NOT NULL REFERENCES tasks (id) ON DELETE CASCADE,
    status INTEGER NOT NULL,               -- 0 waits, 1 is being sent
    share TEXT NOT NULL,
    path TEXT NOT NULL,
    UNIQUE (task, status, share, path)
);
CREATE TABLE runs (
    id INTEGER PRIMARY KEY AUTOINCREMENT,
    task INTEGER NOT NULL REFERENCES tasks (id) ON DELETE CASCADE,
    reason INTEGER NOT NULL,               -- 0 schedule, 1 change, 2 request, 3 retry
    start_time INTEGER NOT NULL,           -- seconds since the epoch
    end_time INTEGER NOT NULL DEFAULT 0,   -- 0 while it runs
    result INTEGER NOT NULL DEFAULT 0,     -- 1 success, 2 failed, 3 cancelled
    status INTEGER NOT NULL DEFAULT 0,
    error TEXT NOT NULL DEFAULT '',
    files_sent INTEGER NOT NULL DEFAULT 0,
    files_deleted INTEGER NOT NULL DEFAULT 0,
    bytes_sent INTEGER NOT NULL DEFAULT 0,
    rsync_runs INTEGER NOT NULL DEFAULT 0
);
CREATE INDEX runs_of_task ON runs (task, id);
CREATE INDEX runs_not_ended ON runs (id) WHERE end_time = 0;
)";

constexpr char kDetails[] = R"(
ALTER TABLE runs ADD COLUMN details TEXT NOT NULL DEFAULT '';  -- what rsync and ssh wrote
)";

// Each share's state begins anew with the daemon.
constexpr char kNoWholeDue[] = "ALTER TABLE tasks DROP COLUMN whole_due";

// How many files the copy of a share has, as its last push has left it; and what waits for a
// person, where `list` has a line for each of the first things that would be lost.
constexpr char kCopies[] = R"(
CREATE TABLE copies (
    task INTEGER NOT NULL REFERENCES tasks (id) ON DELETE CASCADE,
    share TEXT NOT NULL,
    files INTEGER NOT NULL,
    PRIMARY KEY (task, share)
) WITHOUT ROWID;
CREATE TABLE questions (
    task INTEGER NOT NULL REFERENCES tasks (id) ON DELETE CASCADE,
    share TEXT NOT NULL,
    reason TEXT NOT NULL,
    text TEXT NOT NULL,
    amount INTEGER NOT NULL,
    list TEXT NOT NULL,
    PRIMARY KEY (task, share)
) WITHOUT ROWID;
)";

// When all shares of the task were last compared whole, in seconds since the epoch; 0: never.
constexpr size_t kComparedLayout = 5;
constexpr char kCompared[] = "ALTER TABLE tasks ADD COLUMN compared INTEGER NOT NULL DEFAULT 0;\n";

// What the accounts of servers have last taken as this machine's configuration.
constexpr size_t kDepositsLayout = 6;
constexpr char kDeposits[] = R"(
CREATE TABLE deposits (
    server TEXT NOT NULL,
    user TEXT NOT NULL,
    digest TEXT NOT NULL,
    time INTEGER NOT NULL,                 -- seconds since the epoch
    PRIMARY KEY (server, user)
) WITHOUT ROWID;
)";

// How far each share's copy is verified, see VerifyRound, and which of its files have other bytes
// at the two ends.
constexpr size_t kVerifiedLayout = 7;
constexpr char kVerified[] = R"(
CREATE TABLE verified (
    task INTEGER NOT NULL REFERENCES tasks (id) ON DELETE CASCADE,
    share TEXT NOT NULL,
    begun INTEGER NOT NULL,                -- seconds since the epoch, like the next
    ended INTEGER NOT NULL,
    goes_on INTEGER NOT NULL,
    place TEXT NOT NULL,
    files INTEGER NOT NULL,
    bytes INTEGER NOT NULL,
    all_files INTEGER NOT NULL,
    all_bytes INTEGER NOT NULL,
    PRIMARY KEY (task, share)
) WITHOUT ROWID;
CREATE TABLE damaged (
    task INTEGER NOT NULL REFERENCES tasks (id) ON DELETE CASCADE,
    share TEXT NOT NULL,
    path TEXT NOT NULL,
    length INTEGER NOT NULL,
    PRIMARY KEY (task, share, path)
) WITHOUT ROWID;
)";

// What was moved within a share, until its server was told.
constexpr size_t kMovesLayout = 8;
constexpr char kMoves[] = R"(
CREATE TABLE moves (
    id INTEGER PRIMARY KEY AUTOINCREMENT,
    task INTEGER NOT NULL REFERENCES tasks (id) ON DELETE CASCADE,
    share TEXT NOT NULL,
    source TEXT NOT NULL,
    target TEXT NOT NULL
);
CREATE INDEX moves_of_share ON moves (task, share, id);
)";

// A setting that tasks have not always had: nobody has said anything of it yet.
std::string NewColumn(const programs::TaskField& field) {
    const std::string type = field.kind == programs::FieldKind::kText ? " TEXT NOT NULL DEFAULT ''"
                             : field.kind == programs::FieldKind::kTexts
                                 ? " TEXT NOT NULL DEFAULT '[]'"
                                 : " INTEGER NOT NULL DEFAULT " + std::to_string(field.fallback);
    return std::string("ALTER TABLE tasks ADD COLUMN ") + field.key + type + ";\n";
}

}  // namespace

const SchemaSteps& StoreSchema() {
    static const SchemaSteps steps = [] {
        SchemaSteps all = {kFirst, kDetails, kNoWholeDue, kCopies};
        for (const programs::TaskField& field : programs::TaskFields()) {
            if (field.layout > 1) {
                const auto layout = static_cast<size_t>(field.layout);
                all.resize(std::max(all.size(), layout));
                all[layout - 1] += NewColumn(field);
            }
        }
        all.resize(std::max(all.size(), kMovesLayout));
        all[kComparedLayout - 1] += kCompared;
        all[kDepositsLayout - 1] += kDeposits;
        all[kVerifiedLayout - 1] += kVerified;
        all[kMovesLayout - 1] += kMoves;
        return all;
    }();
    return steps;
}

bool IsBlank(Database& database) {
    return database.Number("PRAGMA application_id") == 0 &&
           database.Number("PRAGMA user_version") == 0 &&
           database.Number("SELECT count(*) FROM sqlite_schema") == 0;
}

void BringUpToDate(Database& database, const SchemaSteps& steps) {
    const int64_t application = database.Number("PRAGMA application_id");
    const int64_t version = database.Number("PRAGMA user_version");
    if (application != kApplicationId && !IsBlank(database)) {
        throw Failure(FailureKind::kLocal,
                      "it is a database of another program; name another file");
    }
    const auto known = static_cast<int64_t>(steps.size());
    if (version < 0 || version > known) {
        throw Failure(FailureKind::kLocal,
                      "its layout has version " + std::to_string(version) +
                          ", and this program knows versions up to " + std::to_string(known) +
                          "; install the newer program again, or put back a copy of the file");
    }
    for (int64_t step = version; step < known; ++step) {
        Transaction transaction(database);
        database.Execute(steps[static_cast<size_t>(step)].c_str());
        database.Execute(("PRAGMA application_id = " + std::to_string(kApplicationId)).c_str());
        database.Execute(("PRAGMA user_version = " + std::to_string(step + 1)).c_str());
        transaction.Commit();
    }
}

}  // namespace zel_daemon
