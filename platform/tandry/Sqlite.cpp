#include "platform/tandry/Sqlite.h"

#include <fcntl.h>
#include <openssl/evp.h>
#include <sqlite3.h>
#include <sys/stat.h>

#include <cerrno>

#include "platform/system/UniqueFd.h"

namespace platform::tandry {

namespace {

constexpr int kBusyMilliseconds = 1000;

/// A digest over values, which is told apart by their types and sizes.
class Checksum {
  public:
    Checksum() : digest_(EVP_MD_fetch(nullptr, "SHA1", nullptr)), context_(EVP_MD_CTX_new()) {}
    Checksum(const Checksum&) = delete;
    ~Checksum() {
        EVP_MD_CTX_free(context_);
        EVP_MD_free(digest_);
    }

    void answer(sqlite3_context* result, int count, sqlite3_value** values) {
        unsigned char sum[EVP_MAX_MD_SIZE];
        unsigned size = 0;
        EVP_DigestInit_ex2(context_, digest_, nullptr);
        for (int i = 0; i < count; ++i) add(values[i]);
        EVP_DigestFinal_ex(context_, sum, &size);
        sqlite3_result_blob(result, sum, static_cast<int>(size), SQLITE_TRANSIENT);
    }

  private:
    void add(sqlite3_value* value) {
        const int type = sqlite3_value_type(value);
        if (type == SQLITE_INTEGER) {
            put(type, sqlite3_value_int64(value));
        } else if (type == SQLITE_FLOAT) {
            put(type, sqlite3_value_double(value));
        } else {
            const void* bytes = sqlite3_value_blob(value);
            const int size = sqlite3_value_bytes(value);
            put(type, std::int64_t{size});
            EVP_DigestUpdate(context_, bytes, static_cast<std::size_t>(size));
        }
    }

    template <class Number>
    void put(int type, Number number) {
        EVP_DigestUpdate(context_, &type, sizeof type);
        EVP_DigestUpdate(context_, &number, sizeof number);
    }

    EVP_MD* digest_;
    EVP_MD_CTX* context_;
};

void checksumFunction(sqlite3_context* result, int count, sqlite3_value** values) {
    static_cast<Checksum*>(sqlite3_user_data(result))->answer(result, count, values);
}

void deleteChecksum(void* checksum) {
    delete static_cast<Checksum*>(checksum);
}

Error errorOf(sqlite3* handle, int code) {
    return {"SQLite", code & 0xFF, handle ? sqlite3_errmsg(handle) : sqlite3_errstr(code)};
}

}  // namespace

void SqliteDatabase::Closer::operator()(sqlite3* handle) const {
    sqlite3_close_v2(handle);
}

Result<SqliteDatabase> SqliteDatabase::open(const std::string& path) {
    // SQLite would make it readable by everybody, and gives its other files the same mode.
    const UniqueFd made(
        ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NONBLOCK, S_IRUSR | S_IWUSR));
    SqliteDatabase database;
    sqlite3* handle = nullptr;
    int code = sqlite3_open_v2(path.c_str(), &handle, SQLITE_OPEN_READWRITE | SQLITE_OPEN_NOMUTEX,
                               nullptr);
    database.handle_.reset(handle);
    if (code == SQLITE_OK) code = sqlite3_busy_timeout(handle, kBusyMilliseconds);
    if (code == SQLITE_OK)
        code = sqlite3_create_function_v2(handle, "checksum", -1,
                                          SQLITE_UTF8 | SQLITE_DETERMINISTIC, new Checksum,
                                          checksumFunction, nullptr, nullptr, deleteChecksum);
    if (code != SQLITE_OK) return errorOf(handle, code);
    return database;
}

void SqliteDatabase::releaseMemory() {
    if (handle_) sqlite3_db_release_memory(handle_.get());
}

bool SqliteDatabase::hasMoved() const {
    int moved = 0;
    const int code = sqlite3_file_control(handle_.get(), nullptr, SQLITE_FCNTL_HAS_MOVED, &moved);
    return code == SQLITE_OK && moved != 0;
}

Error SqliteDatabase::lastError() const {
    return errorOf(handle_.get(), sqlite3_errcode(handle_.get()));
}

std::optional<Error> SqliteDatabase::run(const char* sql) {
    if (sqlite3_exec(handle_.get(), sql, nullptr, nullptr, nullptr) == SQLITE_OK)
        return std::nullopt;
    return lastError();
}

Result<std::int64_t> SqliteDatabase::integer(const char* sql) {
    SqliteStatement statement(*this, sql);
    const bool found = statement.next();
    if (statement.error()) return *statement.error();
    return found ? statement.integer(0) : 0;
}

void SqliteStatement::Finalizer::operator()(sqlite3_stmt* handle) const {
    sqlite3_finalize(handle);
}

SqliteStatement::SqliteStatement(SqliteDatabase& database, const char* sql) : database_(&database) {
    sqlite3_stmt* handle = nullptr;
    const int code = sqlite3_prepare_v2(database.handle_.get(), sql, -1, &handle, nullptr);
    check(code);
    if (code == SQLITE_ERROR) error_->code = SQLITE_SCHEMA;
    handle_.reset(handle);
}

void SqliteStatement::check(int code) {
    if (code != SQLITE_OK && code != SQLITE_ROW && code != SQLITE_DONE && !error_)
        error_ = database_->lastError();
}

void SqliteStatement::bind(int index, const Parameter& parameter) {
    sqlite3_stmt* handle = handle_.get();
    const char* bytes = parameter.bytes_.data() ? parameter.bytes_.data() : "";
    const sqlite3_uint64 size = parameter.bytes_.size();
    switch (parameter.kind_) {
        case Parameter::Kind::Null:
            return check(sqlite3_bind_null(handle, index));
        case Parameter::Kind::Integer:
            return check(sqlite3_bind_int64(handle, index, parameter.integer_));
        case Parameter::Kind::Real:
            return check(sqlite3_bind_double(handle, index, parameter.real_));
        case Parameter::Kind::Text:
            return check(
                sqlite3_bind_text64(handle, index, bytes, size, SQLITE_STATIC, SQLITE_UTF8));
        case Parameter::Kind::Blob:
            return check(sqlite3_bind_blob64(handle, index, bytes, size, SQLITE_STATIC));
    }
}

void SqliteStatement::execute(std::initializer_list<Parameter> parameters) {
    int index = 0;
    for (const Parameter& parameter : parameters)
        if (!error_) bind(++index, parameter);
    while (next()) continue;
    if (handle_) {
        sqlite3_reset(handle_.get());
        sqlite3_clear_bindings(handle_.get());
    }
}

bool SqliteStatement::next() {
    if (error_) return false;
    const int code = sqlite3_step(handle_.get());
    check(code);
    return code == SQLITE_ROW;
}

std::string_view SqliteStatement::bytes(int column) const {
    const void* bytes = sqlite3_column_blob(handle_.get(), column);
    const int size = sqlite3_column_bytes(handle_.get(), column);
    return bytes ? std::string_view(static_cast<const char*>(bytes), size) : std::string_view();
}

std::optional<std::string> SqliteStatement::optionalText(int column) const {
    if (sqlite3_column_type(handle_.get(), column) == SQLITE_NULL) return std::nullopt;
    return text(column);
}

std::int64_t SqliteStatement::integer(int column) const {
    return sqlite3_column_int64(handle_.get(), column);
}

double SqliteStatement::real(int column) const {
    return sqlite3_column_double(handle_.get(), column);
}

}  // namespace platform::tandry
