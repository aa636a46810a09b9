#include "programs/zel_daemon/sqlite.h"

#include "base/utf8.h"

namespace zel_daemon {

namespace {

// A person's sqlite3 shell may hold the file for a moment.
constexpr int kBusyMilliseconds = 5000;

bool IsText(const std::string& value) {
    return value.find('\0') == std::string::npos && base::IsUtf8(value);
}

}  // namespace

Database::Database(const std::string& path) {
    sqlite3* handle = nullptr;
    const int code = sqlite3_open_v2(path.c_str(), &handle,
                                     SQLITE_OPEN_READWRITE | SQLITE_OPEN_EXRESCODE, nullptr);
    handle_.reset(handle);  // also after a failure, which leaves a handle with the error's text
    Check(code);
    Check(sqlite3_busy_timeout(handle, kBusyMilliseconds));
    // What a damaged or forged schema asks for is not done.
    Check(sqlite3_db_config(handle, SQLITE_DBCONFIG_DEFENSIVE, 1, nullptr));
    Check(sqlite3_db_config(handle, SQLITE_DBCONFIG_TRUSTED_SCHEMA, 0, nullptr));
}

void Database::Execute(const char* statements) {
    Check(sqlite3_exec(Handle(), statements, nullptr, nullptr, nullptr));
}

int64_t Database::Number(const char* statement) {
    Query query(*this, statement);
    return query.Next() ? query.Number() : 0;
}

sqlite3_stmt* Database::Prepared(const std::string& statement) {
    auto& prepared = prepared_[statement];
    if (prepared == nullptr) {
        sqlite3_stmt* fresh = nullptr;
        Check(sqlite3_prepare_v3(Handle(), statement.c_str(), -1, SQLITE_PREPARE_PERSISTENT, &fresh,
                                 nullptr));
        prepared.reset(fresh);
    }
    return prepared.get();
}

void Database::Check(int code) const {
    if (code == SQLITE_OK || code == SQLITE_ROW || code == SQLITE_DONE) {
        return;
    }
    if (handle_ == nullptr) {
        throw SqliteError(SQLITE_NOMEM, sqlite3_errstr(SQLITE_NOMEM));
    }
    const int primary = code & 0xff;
    const bool is_systems = primary == SQLITE_CANTOPEN || primary == SQLITE_IOERR;
    throw SqliteError(code, sqlite3_errmsg(Handle()),
                      is_systems ? sqlite3_system_errno(Handle()) : 0);
}

Query::~Query() {
    // A statement that stayed at its row would hold the file's old state, and the log of changes
    // could not be cut.
    sqlite3_reset(statement_);
    sqlite3_clear_bindings(statement_);
}

void Query::Bind(const std::string& value) {
    database_.Check(IsText(value) ? sqlite3_bind_text64(statement_, ++bound_, value.data(),
                                                        value.size(), SQLITE_TRANSIENT, SQLITE_UTF8)
                                  : sqlite3_bind_blob64(statement_, ++bound_, value.data(),
                                                        value.size(), SQLITE_TRANSIENT));
}

void Query::Bind(const Bytes& bytes) {
    const std::string_view value = bytes.value;
    database_.Check(sqlite3_bind_blob64(statement_, ++bound_, value.empty() ? "" : value.data(),
                                        value.size(), SQLITE_TRANSIENT));
}

void Query::BindNumber(int64_t value) {
    database_.Check(sqlite3_bind_int64(statement_, ++bound_, value));
}

bool Query::Next() {
    read_ = 0;
    const int code = sqlite3_step(statement_);
    database_.Check(code);
    return code == SQLITE_ROW;
}

bool Query::NextIsNumber() const {
    return sqlite3_column_type(statement_, read_) == SQLITE_INTEGER;
}

int64_t Query::Number() {
    return sqlite3_column_int64(statement_, read_++);
}

std::string Query::Text() {
    const int column = read_++;
    const void* const bytes = sqlite3_column_blob(statement_, column);
    const int size = sqlite3_column_bytes(statement_, column);
    return bytes == nullptr
               ? std::string()
               : std::string(static_cast<const char*>(bytes), static_cast<size_t>(size));
}

Transaction::Transaction(Database& database, Kind kind) : database_(database) {
    // As a writer from the start: a reader that becomes one can be turned away half-way.
    database.Execute(kind == Kind::kWrite ? "BEGIN IMMEDIATE" : "BEGIN");
}

Transaction::~Transaction() {
    // SQLite has ended it itself after some errors.
    if (database_.InTransaction()) {
        try {
            database_.Execute("ROLLBACK");
        } catch (const SqliteError&) {
            // The file is as it was: the next one who opens it takes back what is not committed.
        }
    }
}

}  // namespace zel_daemon
