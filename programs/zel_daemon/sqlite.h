// Owners of SQLite's handles, and its errors as exceptions.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <stdexcept>
#include <string>
#include <string_view>
#include <type_traits>
#include <unordered_map>

namespace zel_daemon {

/// SQLite refused something; what() is its own text.
class SqliteError : public std::runtime_error {
public:
    SqliteError(int code, const std::string& text, int system_error = 0)
        : std::runtime_error(text), code_(code), system_error_(system_error) {}
    /// The extended result code.
    int Code() const { return code_; }
    /// The kind of error that it belongs to.
    int PrimaryCode() const { return code_ & 0xff; }

    /// What the system said when a file could not be opened or read, or 0.
    int SystemError() const { return system_error_; }

private:
    int code_;
    int system_error_;
};

/// One open database file, which must be there already.
///
/// Threads: one thread.
class Database {
public:
    explicit Database(const std::string& path);

    /// Runs statements that take and give no values.
    void Execute(const char* statements);
    /// The first value of the first row that a statement gives.
    int64_t Number(const char* statement);
    bool IsReadOnly() const { return sqlite3_db_readonly(handle_.get(), "main") == 1; }
    bool InTransaction() const { return sqlite3_get_autocommit(handle_.get()) == 0; }
    /// The id of the row that was inserted last.
    uint64_t LastId() const { return static_cast<uint64_t>(sqlite3_last_insert_rowid(Handle())); }
    /// Rows that the last statement changed.
    int Changes() const { return sqlite3_changes(Handle()); }

private:
    friend class Query;

    struct Close {
        void operator()(sqlite3* handle) const { sqlite3_close_v2(handle); }
    };
    struct Finalize {
        void operator()(sqlite3_stmt* statement) const { sqlite3_finalize(statement); }
    };

    sqlite3* Handle() const { return handle_.get(); }
    sqlite3_stmt* Prepared(const std::string& statement);
    void Check(int code) const;

    std::unique_ptr<sqlite3, Close> handle_;
    std::unordered_map<std::string, std::unique_ptr<sqlite3_stmt, Finalize>> prepared_;
};

/// Bytes that are stored as such, text or not: they compare byte by byte.
struct Bytes {
    std::string_view value;
};

/// One use of a statement, which is prepared once and kept by its database. The same text must not
/// be in use twice at a time.
///
/// Strings hold any bytes. Those that are text are stored as text, so that a person can read and
/// compare them in the sqlite3 shell; others are stored as blobs.
class Query {
public:
    /// Binds the values to the statement's parameters, in order.
    template <typename... Values>
    Query(Database& database, const std::string& statement, const Values&... values)
        : database_(database), statement_(database.Prepared(statement)) {
        (Bind(values), ...);
    }
    ~Query();
    Query(const Query&) = delete;
    Query& operator=(const Query&) = delete;

    /// Binds the next parameter.
    template <typename Number, std::enable_if_t<std::is_integral_v<Number>, int> = 0>
    void Bind(Number value) {
        BindNumber(static_cast<int64_t>(value));
    }
    void Bind(const std::string& value);
    void Bind(const Bytes& bytes);

    /// Goes on to the next row; false when there is none.
    bool Next();
    /// For statements that give no rows.
    void Run() { Next(); }

    // The row's next column; 0 or empty for NULL.
    bool NextIsNumber() const;
    int64_t Number();
    std::string Text();

private:
    void BindNumber(int64_t value);

    Database& database_;
    sqlite3_stmt* statement_;
    int bound_ = 0;
    int read_ = 0;
};

/// Everything until Commit() happens as a whole or, without it, not at all.
class Transaction {
public:
    enum class Kind {
        kWrite,
        kRead  ///< all that is read is of one moment and costs one lock; nobody else can write
    };
    explicit Transaction(Database& database, Kind kind = Kind::kWrite);
    ~Transaction();
    Transaction(const Transaction&) = delete;
    Transaction& operator=(const Transaction&) = delete;

    void Commit() { database_.Execute("COMMIT"); }

private:
    Database& database_;
};

}  // namespace zel_daemon
