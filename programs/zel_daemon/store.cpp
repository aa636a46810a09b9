#include "programs/zel_daemon/store.h"

#include <algorithm>
#include <cerrno>
#include <system_error>

#include "programs/common/failure.h"
#include "programs/zel_daemon/change_set.h"
#include "programs/zel_daemon/shortage.h"
#include "programs/zel_daemon/store_file.h"
#include "programs/zel_daemon/store_schema.h"
#include "programs/zel_daemon/stored_task.h"

namespace zel_daemon {

namespace {

using programs::Failure;
using programs::FailureKind;

constexpr char kStopped[] = "the daemon was stopped";

constexpr char kRunColumns[] =
    "id, task, reason, start_time, end_time, result, status, error, details, files_sent, "
    "files_deleted, bytes_sent, rsync_runs";

constexpr char kMakeRoom[] = "the disk is full; make room on it";

const char* Advice(const std::error_code& error) {
    return error == std::errc::no_space_on_device || error.value() == EDQUOT
               ? kMakeRoom
               : "see that the daemon's user may write there";
}

bool IsDamage(const SqliteError& error) {
    return error.PrimaryCode() == SQLITE_CORRUPT || error.PrimaryCode() == SQLITE_NOTADB;
}

std::string Advice(const SqliteError& error) {
    if (error.SystemError() == EMFILE || error.SystemError() == ENFILE) {
        return ReasonOf(error.SystemError());
    }
    switch (error.Code()) {
        case SQLITE_CONSTRAINT_UNIQUE:
            return "the name is taken; choose another one";
        case SQLITE_CONSTRAINT_FOREIGNKEY:
            return "there is no such task";
        default:
            break;
    }
    switch (error.PrimaryCode()) {
        case SQLITE_CORRUPT:
        case SQLITE_NOTADB:
            return std::string("the file is damaged and is left as it is; ") + kBeginAnew;
        case SQLITE_FULL:
            return kMakeRoom;
        case SQLITE_READONLY:
        case SQLITE_CANTOPEN:
        case SQLITE_PERM:
            return "see that the daemon's user may write to the file and to its folder";
        case SQLITE_BUSY:
        case SQLITE_LOCKED:
            return "another program is using the file; end it and try again";
        case SQLITE_IOERR:
            return "look for errors of the disk in the system's log";
        default:
            return "see the daemon's log";
    }
}

RunRecord ReadRun(Query& query) {
    RunRecord run;
    run.id = static_cast<uint64_t>(query.Number());
    run.task_id = static_cast<uint64_t>(query.Number());
    run.reason = static_cast<RunReason>(query.Number());
    run.start = query.Number();
    run.end = query.Number();
    run.result = static_cast<ZEL::TASK_RESULT>(query.Number());
    run.status = static_cast<int>(query.Number());
    run.error = query.Text();
    run.details = query.Text();
    run.files_sent = static_cast<uint64_t>(query.Number());
    run.files_deleted = static_cast<uint64_t>(query.Number());
    run.bytes_sent = static_cast<uint64_t>(query.Number());
    run.rsync_runs = static_cast<uint64_t>(query.Number());
    return run;
}

ZEL::Event ReadEvent(Query& query) {
    ZEL::Event event;
    event.SetID(static_cast<uint64_t>(query.Number()));
    event.SetShareName(query.Text());
    event.SetRelativePath(query.Text());
    return event;
}

StoredMove ReadMove(Query& query) {
    StoredMove stored;
    stored.id = static_cast<uint64_t>(query.Number());
    stored.move.from = query.Text();
    stored.move.to = query.Text();
    return stored;
}

DepositNote ReadDeposit(Query& query) {
    DepositNote deposit;
    deposit.server = query.Text();
    deposit.user = query.Text();
    deposit.digest = query.Text();
    deposit.time = query.Number();
    return deposit;
}

template <typename Record>
std::vector<Record> ReadAll(Query&& query, Record (*read)(Query&)) {
    std::vector<Record> records;
    while (query.Next()) {
        records.push_back(read(query));
    }
    return records;
}

}  // namespace

struct Store::Impl {
    explicit Impl(const std::string& file) : path(file) {}

    // Does `work`, and words every failure: the file, what failed, why, and what to do.
    template <typename Work>
    auto Do(const std::string& what, Work work) const {
        const std::string failed = path + ": cannot " + what + ": ";
        try {
            return work();
        } catch (const SqliteError& error) {
            throw Failure(IsDamage(error) ? FailureKind::kLocal : FailureKind::kFailed,
                          failed + error.what() + "; " + Advice(error));
        } catch (const Failure& failure) {
            throw Failure(failure.Kind(), failed + failure.what());
        } catch (const std::system_error& error) {
            throw Failure(failed + error.what() + "; " + Advice(error.code()));
        }
    }

    // The same, as a whole or not at all.
    template <typename Work>
    auto Change(const std::string& what, Work work) {
        return Do(what, [&] {
            Transaction transaction(*database);
            if constexpr (std::is_void_v<decltype(work())>) {
                work();
                transaction.Commit();
            } else {
                const auto result = work();
                transaction.Commit();
                return result;
            }
        });
    }

    void Update(const TaskRecord& record) {
        Query query(*database, "UPDATE tasks SET (" + TaskColumns() + ") = (" + TaskParameters() +
                                   ") WHERE id = ?");
        BindTask(query, record);
        query.Bind(record.ID());
        query.Run();
        if (database->Changes() == 0) {
            throw SqliteError(SQLITE_CONSTRAINT_FOREIGNKEY, "id " + std::to_string(record.ID()));
        }
    }

    void SetQuestion(uint64_t task, const std::string& share,
                     const std::optional<programs::Question>& question) {
        if (!question) {
            Query(*database, "DELETE FROM questions WHERE task = ? AND share = ?", task, share)
                .Run();
            return;
        }
        std::string list;
        for (const std::string& line : question->list) {
            list += line + "\n";
        }
        Query(*database,
              "INSERT OR REPLACE INTO questions (task, share, reason, text, amount, list) "
              "VALUES (?, ?, ?, ?, ?, ?)",
              task, share, question->reason, question->text, question->amount, list)
            .Run();
    }

    // `statement` has one parameter, the ids as a JSON array: one statement costs half of many.
    void ForIds(const std::vector<uint64_t>& ids, const char* statement) {
        std::string list;
        for (const uint64_t id : ids) {
            list += (list.empty() ? "[" : ",") + std::to_string(id);
        }
        if (!ids.empty()) {
            Query(*database, statement, list + "]").Run();
        }
    }

    void AddEvents(uint64_t task, const std::string& share, const std::vector<std::string>& paths) {
        for (const std::string& added : paths) {
            Query(*database,
                  "INSERT INTO events (task, status, share, path) VALUES (?, 0, ?, ?) "
                  "ON CONFLICT DO NOTHING",
                  task, share, added)
                .Run();
        }
    }

    // Of a server that is away for long, with a share that changes much.
    void FoldEvents(uint64_t task, const std::string& share) {
        Query count(*database,
                    "SELECT count(*) FROM events WHERE task = ? AND status = 0 AND share = ?", task,
                    share);
        count.Next();
        if (static_cast<uint64_t>(count.Number()) <= Store::kMaxWaiting) {
            return;
        }
        ChangeSet changes;
        Query waiting(*database,
                      "SELECT path FROM events WHERE task = ? AND status = 0 AND share = ?", task,
                      share);
        while (waiting.Next()) {
            changes.Add(waiting.Text());
        }
        Query(*database, "DELETE FROM events WHERE task = ? AND status = 0 AND share = ?", task,
              share)
            .Run();
        AddEvents(task, share, changes.Take());
    }

    const std::string path;
    std::optional<Database> database;
};

Store::Store(const std::string& path) : impl_(std::make_unique<Impl>(path)) {
    impl_->Do("open the store", [&] {
        PrepareStoreFile(path);
        Database& database = impl_->database.emplace(path);
        if (IsBlank(database)) {
            throw LostStore("it is a database without anything in it");
        }
        if (database.IsReadOnly()) {
            throw SqliteError(SQLITE_READONLY, sqlite3_errstr(SQLITE_READONLY));
        }
        BringUpToDate(database, StoreSchema());
        // What an operation has answered stays, through a power cut too.
        database.Execute(
            "PRAGMA journal_mode = WAL; PRAGMA synchronous = FULL; PRAGMA foreign_keys = ON; "
            "PRAGMA cell_size_check = ON");
        MarkStoreFile(path);
    });
    // When a run was cut off nobody knows: its start is what is sure. No time at all would make it
    // run for ever.
    impl_->Change("take up the runs that were cut off", [&] {
        Query(*impl_->database,
              "UPDATE runs SET end_time = max(start_time, 1), result = ?, error = ? "
              "WHERE end_time = 0",
              ZEL::TASK_RESULT_FAILED + 0, std::string(kStopped))
            .Run();
        impl_->database->Execute("UPDATE OR REPLACE events SET status = 0 WHERE status = 1");
    });
}

Store::~Store() = default;

const std::string& Store::Path() const {
    return impl_->path;
}

std::string Store::Renew(const std::string& path) {
    std::string aside = Impl(path).Do("begin anew", [&] { return PutStoreAside(path); });
    const Store fresh(path);
    return aside;
}

std::vector<TaskRecord> Store::Tasks() {
    return impl_->Do("read the tasks", [&] {
        return ReadAll(
            Query(*impl_->database, "SELECT id, " + TaskColumns() + " FROM tasks ORDER BY id"),
            ReadTask);
    });
}

uint64_t Store::AddTask(const TaskRecord& record) {
    return impl_->Change("store task '" + record.Name() + "'", [&] {
        Query query(*impl_->database,
                    "INSERT INTO tasks (" + TaskColumns() + ") VALUES (" + TaskParameters() + ")");
        BindTask(query, record);
        query.Run();
        return impl_->database->LastId();
    });
}

void Store::UpdateTask(const TaskRecord& record) {
    impl_->Change("store task '" + record.Name() + "'", [&] { impl_->Update(record); });
}

void Store::ResetTask(const TaskRecord& record, bool other_copies) {
    impl_->Change("store task '" + record.Name() + "'", [&] {
        impl_->Update(record);
        Query(*impl_->database, "DELETE FROM events WHERE task = ?", record.ID()).Run();
        Query(*impl_->database, "DELETE FROM moves WHERE task = ?", record.ID()).Run();
        Query(*impl_->database, "DELETE FROM questions WHERE task = ?", record.ID()).Run();
        for (const char* const table : {"copies", "verified", "damaged"}) {
            Query(*impl_->database,
                  std::string("DELETE FROM ") + table +
                      " WHERE task = ?1 AND (?2 OR share NOT IN (SELECT value FROM tasks, "
                      "json_each(share_list) WHERE tasks.id = ?1))",
                  record.ID(), other_copies)
                .Run();
        }
    });
}

void Store::RemoveTask(uint64_t id) {
    impl_->Change("remove a task",
                  [&] { Query(*impl_->database, "DELETE FROM tasks WHERE id = ?", id).Run(); });
}

void Store::AddEvents(uint64_t task_id, const std::string& share,
                      const std::vector<std::string>& paths,
                      const std::vector<programs::ShareMove>& moves) {
    impl_->Change("store changes", [&] {
        for (const programs::ShareMove& move : moves) {
            Query(*impl_->database,
                  "INSERT INTO moves (task, share, source, target) VALUES (?, ?, ?, ?)", task_id,
                  share, move.from, move.to)
                .Run();
        }
        if (!moves.empty()) {
            Query(*impl_->database,
                  "DELETE FROM moves WHERE task = ?1 AND share = ?2 AND id <= (SELECT id FROM "
                  "moves WHERE task = ?1 AND share = ?2 ORDER BY id DESC LIMIT 1 OFFSET ?3)",
                  task_id, share, kMovesKept)
                .Run();
        }
        impl_->AddEvents(task_id, share, paths);
        impl_->FoldEvents(task_id, share);
    });
}

std::vector<ZEL::Event> Store::PendingEvents(uint64_t task_id) {
    return impl_->Do("read the changes", [&] {
        return ReadAll(
            Query(*impl_->database,
                  "SELECT id, share, path FROM events WHERE task = ? AND status = 0 ORDER BY id",
                  task_id),
            ReadEvent);
    });
}

std::vector<ZEL::Event> Store::PendingEvents(uint64_t task_id, const std::string& share,
                                             uint64_t after) {
    return impl_->Do("read the changes", [&] {
        return ReadAll(Query(*impl_->database,
                             "SELECT id, share, path FROM events WHERE task = ? AND status = 0 "
                             "AND share = ? AND id > ? ORDER BY id",
                             task_id, share, after),
                       ReadEvent);
    });
}

std::vector<StoredMove> Store::Moves(uint64_t task_id, const std::string& share) {
    return impl_->Do("read what was moved", [&] {
        return ReadAll(Query(*impl_->database,
                             "SELECT id, source, target FROM moves WHERE task = ? AND share = ? "
                             "ORDER BY id",
                             task_id, share),
                       ReadMove);
    });
}

uint64_t Store::CountEvents(uint64_t task_id) {
    return impl_->Do("count the changes", [&] {
        Query query(*impl_->database, "SELECT count(*) FROM events WHERE task = ?", task_id);
        query.Next();
        return static_cast<uint64_t>(query.Number());
    });
}

// A change that comes to another one of the same path in the same state takes its place.
uint64_t Store::BeginRun(uint64_t task_id, RunReason reason, int64_t start,
                         const std::vector<uint64_t>& sending) {
    return impl_->Change("note the beginning of a run", [&] {
        impl_->ForIds(sending,
                      "UPDATE OR REPLACE events SET status = 1 "
                      "WHERE id IN (SELECT value FROM json_each(?))");
        Query(*impl_->database, "INSERT INTO runs (task, reason, start_time) VALUES (?, ?, ?)",
              task_id, static_cast<int>(reason), start)
            .Run();
        const uint64_t id = impl_->database->LastId();
        Query(*impl_->database,
              "DELETE FROM runs WHERE task = ?1 AND id <= "
              "(SELECT id FROM runs WHERE task = ?1 ORDER BY id DESC LIMIT 1 OFFSET ?2)",
              task_id, kRunsKept)
            .Run();
        return id;
    });
}

void Store::EndRun(const RunRecord& run, const RunEnd& end) {
    impl_->Change("note the end of a run", [&] {
        impl_->ForIds(end.sent, "DELETE FROM events WHERE id IN (SELECT value FROM json_each(?))");
        impl_->ForIds(end.moved, "DELETE FROM moves WHERE id IN (SELECT value FROM json_each(?))");
        impl_->ForIds(end.unsent,
                      "UPDATE OR REPLACE events SET status = 0 "
                      "WHERE id IN (SELECT value FROM json_each(?))");
        Query(*impl_->database,
              "UPDATE runs SET end_time = ?, result = ?, status = ?, error = ?, details = ?, "
              "files_sent = ?, files_deleted = ?, bytes_sent = ?, rsync_runs = ? WHERE id = ?",
              run.end, static_cast<int>(run.result), run.status, run.error, run.details,
              run.files_sent, run.files_deleted, run.bytes_sent, run.rsync_runs, run.id)
            .Run();
        if (impl_->database->Changes() == 0) {
            return;  // the task is gone
        }
        for (const auto& [share, files] : end.files) {
            Query(*impl_->database,
                  "INSERT OR REPLACE INTO copies (task, share, files) VALUES (?, ?, ?)",
                  run.task_id, share, files)
                .Run();
        }
        for (const auto& [share, question] : end.questions) {
            impl_->SetQuestion(run.task_id, share, question);
        }
    });
}

std::map<uint64_t, std::map<std::string, uint64_t>> Store::FilesOfCopies() {
    return impl_->Do("read what is known of the copies", [&] {
        std::map<uint64_t, std::map<std::string, uint64_t>> all;
        Query query(*impl_->database, "SELECT task, share, files FROM copies");
        while (query.Next()) {
            std::map<std::string, uint64_t>& copies = all[static_cast<uint64_t>(query.Number())];
            uint64_t& files = copies[query.Text()];
            files = static_cast<uint64_t>(query.Number());
        }
        return all;
    });
}

std::map<uint64_t, Questions> Store::AllQuestions() {
    return impl_->Do("read what waits for a person", [&] {
        std::map<uint64_t, Questions> all;
        Query query(*impl_->database,
                    "SELECT task, share, reason, text, amount, list FROM questions");
        while (query.Next()) {
            Questions& questions = all[static_cast<uint64_t>(query.Number())];
            programs::Question& question = questions[query.Text()];
            question.reason = query.Text();
            question.text = query.Text();
            question.amount = static_cast<uint64_t>(query.Number());
            const std::string list = query.Text();
            for (size_t begin = 0; begin < list.size();) {
                const size_t end = std::min(list.find('\n', begin), list.size());
                question.list.push_back(list.substr(begin, end - begin));
                begin = end + 1;
            }
        }
        return all;
    });
}

std::map<uint64_t, Verification::Shares> Store::AllVerifications() {
    return impl_->Do("read how far the copies are verified", [&] {
        std::map<uint64_t, Verification::Shares> all;
        Query rounds(*impl_->database,
                     "SELECT task, share, begun, ended, goes_on, place, files, bytes, all_files, "
                     "all_bytes FROM verified");
        while (rounds.Next()) {
            Verification::Shares& shares = all[static_cast<uint64_t>(rounds.Number())];
            VerifyRound& round = shares[rounds.Text()].round;
            round.begun = rounds.Number();
            round.ended = rounds.Number();
            round.goes_on = rounds.Number() != 0;
            round.place = rounds.Text();
            round.files = static_cast<uint64_t>(rounds.Number());
            round.bytes = static_cast<uint64_t>(rounds.Number());
            round.all_files = static_cast<uint64_t>(rounds.Number());
            round.all_bytes = static_cast<uint64_t>(rounds.Number());
        }
        Query damaged(*impl_->database, "SELECT task, share, path, length FROM damaged");
        while (damaged.Next()) {
            Verification::Shares& shares = all[static_cast<uint64_t>(damaged.Number())];
            Verification::Share& share = shares[damaged.Text()];
            const std::string path = damaged.Text();
            share.damaged[path] = static_cast<uint64_t>(damaged.Number());
        }
        return all;
    });
}

void Store::EndSlice(uint64_t task_id, const std::string& share, const VerifiedSlice& slice) {
    impl_->Change("note how far a copy is verified", [&] {
        const VerifyRound& round = slice.round;
        Query(*impl_->database,
              "INSERT OR REPLACE INTO verified (task, share, begun, ended, goes_on, place, files, "
              "bytes, all_files, all_bytes) VALUES (?, ?, ?, ?, ?, ?, ?, ?, ?, ?)",
              task_id, share, round.begun, round.ended, round.goes_on, round.place, round.files,
              round.bytes, round.all_files, round.all_bytes)
            .Run();
        for (const std::string& path : slice.well) {
            Query(*impl_->database, "DELETE FROM damaged WHERE task = ? AND share = ? AND path = ?",
                  task_id, share, path)
                .Run();
        }
        for (const auto& [path, length] : slice.damaged) {
            Query(*impl_->database,
                  "INSERT OR REPLACE INTO damaged (task, share, path, length) VALUES (?, ?, ?, ?)",
                  task_id, share, path, length)
                .Run();
        }
    });
}

std::vector<RunRecord> Store::Runs(uint64_t task_id, unsigned int limit) {
    return impl_->Do("read the history", [&] {
        return ReadAll(Query(*impl_->database,
                             std::string("SELECT ") + kRunColumns +
                                 " FROM runs WHERE task = ? ORDER BY id DESC LIMIT ?",
                             task_id, limit),
                       ReadRun);
    });
}

std::vector<RunRecord> Store::LastRuns() {
    return impl_->Do("read the history", [&] {
        return ReadAll(Query(*impl_->database,
                             std::string("SELECT ") + kRunColumns +
                                 " FROM runs WHERE id IN (SELECT (SELECT max(id) FROM runs WHERE "
                                 "task = tasks.id) FROM tasks) ORDER BY task"),
                       ReadRun);
    });
}

std::vector<DepositNote> Store::Deposits() {
    return impl_->Do("read what servers have of the configuration", [&] {
        return ReadAll(Query(*impl_->database, "SELECT server, user, digest, time FROM deposits"),
                       ReadDeposit);
    });
}

void Store::NoteDeposit(const DepositNote& deposit) {
    impl_->Change("note what a server has of the configuration", [&] {
        Query(*impl_->database,
              "INSERT OR REPLACE INTO deposits (server, user, digest, time) VALUES (?, ?, ?, ?)",
              deposit.server, deposit.user, deposit.digest, deposit.time)
            .Run();
    });
}

}  // namespace zel_daemon
