#pragma once

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/system/Error.h"

struct sqlite3;
struct sqlite3_stmt;

namespace platform::tandry {

/// An open SQLite database, used by one thread at a time. Errors have the domain "SQLite" and its
/// primary result code.
class SqliteDatabase {
  public:
    SqliteDatabase() = default;

    /// Opens the database at `path`, which is made (mode 0600) when missing. It knows the SQL
    /// function `checksum(value, ...)`: a digest over its arguments.
    static Result<SqliteDatabase> open(const std::string& path);

    explicit operator bool() const { return bool(handle_); }
    void close() { handle_.reset(); }
    /// Gives back what it keeps in memory of the file, for who asks nothing for long.
    void releaseMemory();
    /// Whether its path leads to the open file no more.
    bool hasMoved() const;

    /// Runs statements that answer no rows.
    std::optional<Error> run(const char* sql);
    Result<std::int64_t> integer(const char* sql);
    Error lastError() const;

  private:
    friend class SqliteStatement;
    struct Closer {
        void operator()(sqlite3* handle) const;
    };
    std::unique_ptr<sqlite3, Closer> handle_;
};

/// A prepared statement, which must not outlive its database. One that does not fit the database's
/// tables has the error SQLITE_SCHEMA. After a failure every operation does
/// nothing more, and `error` tells of the first.
class SqliteStatement {
  public:
    SqliteStatement(SqliteDatabase& database, const char* sql);

    struct Blob {
        std::string_view bytes;
    };
    /// A parameter: its bytes are borrowed until `reset`.
    class Parameter {
      public:
        Parameter(std::int64_t value) : kind_(Kind::Integer), integer_(value) {}
        Parameter(double value) : kind_(Kind::Real), real_(value) {}
        Parameter(const std::string& text) : kind_(Kind::Text), bytes_(text) {}
        Parameter(Blob blob) : kind_(Kind::Blob), bytes_(blob.bytes) {}
        /// Null when absent.
        Parameter(const std::optional<std::string>& text) : Parameter(std::int64_t{0}) {
            kind_ = text ? Kind::Text : Kind::Null;
            if (text) bytes_ = *text;
        }

      private:
        friend class SqliteStatement;
        enum class Kind { Null, Integer, Real, Text, Blob };
        Kind kind_;
        std::int64_t integer_ = 0;
        double real_ = 0;
        std::string_view bytes_;
    };

    /// Binds the parameters in order and runs the statement to its end.
    void execute(std::initializer_list<Parameter> parameters);
    /// Whether there is another row.
    bool next();

    /// Columns of the current row. Views are good until the next one.
    std::string_view bytes(int column) const;
    std::string text(int column) const { return std::string(bytes(column)); }
    std::optional<std::string> optionalText(int column) const;
    std::int64_t integer(int column) const;
    double real(int column) const;

    const std::optional<Error>& error() const { return error_; }

  private:
    void bind(int index, const Parameter& parameter);
    void check(int code);

    struct Finalizer {
        void operator()(sqlite3_stmt* handle) const;
    };
    SqliteDatabase* database_;
    std::unique_ptr<sqlite3_stmt, Finalizer> handle_;
    std::optional<Error> error_;
};

}  // namespace platform::tandry
