#include "platform/engine/Sqlite.h"

#include <new>

namespace vtc::engine {

namespace {

// Memory this computer cannot give is no damage of the database: it
// travels as std::bad_alloc, never as an EngineError.
void throwIfOutOfMemory(int code) {
  if (code == SQLITE_NOMEM) throw std::bad_alloc();
}

[[noreturn]] void fail(sqlite3* db, const std::string& what) {
  throwIfOutOfMemory(sqlite3_errcode(db));
  throw EngineError(what + ": " + sqlite3_errmsg(db));
}

}  // namespace

Statement::Statement(sqlite3* db, const char* sql) : db_(db) {
  if (sqlite3_prepare_v2(db, sql, -1, &stmt_, nullptr) != SQLITE_OK)
    fail(db, std::string("cannot prepare \"") + sql + "\"");
}

Statement::~Statement() {
  sqlite3_finalize(stmt_);
}

Statement& Statement::bind(int index, const std::string& text) {
  sqlite3_bind_text(stmt_, index, text.data(), static_cast<int>(text.size()), SQLITE_TRANSIENT);
  return *this;
}

Statement& Statement::bind(int index, int64_t number) {
  sqlite3_bind_int64(stmt_, index, number);
  return *this;
}

Statement& Statement::bind(int index, double number) {
  sqlite3_bind_double(stmt_, index, number);
  return *this;
}

Statement& Statement::bind(int index, const Bytes& blob) {
  // An empty blob is a blob, not NULL (an empty vector has no data pointer).
  if (blob.empty())
    sqlite3_bind_zeroblob(stmt_, index, 0);
  else
    sqlite3_bind_blob(stmt_, index, blob.data(), static_cast<int>(blob.size()), SQLITE_TRANSIENT);
  return *this;
}

bool Statement::step() {
  int r = sqlite3_step(stmt_);
  if (r == SQLITE_ROW) return true;
  if (r == SQLITE_DONE) return false;
  fail(db_, "statement failed");
}

void Statement::run() {
  step();
  reset();
}

void Statement::reset() {
  sqlite3_reset(stmt_);
  sqlite3_clear_bindings(stmt_);
}

int64_t Statement::integer(int column) const {
  return sqlite3_column_int64(stmt_, column);
}
double Statement::real(int column) const {
  return sqlite3_column_double(stmt_, column);
}

std::string Statement::text(int column) const {
  const auto* p = sqlite3_column_text(stmt_, column);
  return p ? std::string(reinterpret_cast<const char*>(p),
                         static_cast<size_t>(sqlite3_column_bytes(stmt_, column)))
           : std::string();
}

Bytes Statement::blob(int column) const {
  const auto* p = static_cast<const uint8_t*>(sqlite3_column_blob(stmt_, column));
  return p ? Bytes(p, p + sqlite3_column_bytes(stmt_, column)) : Bytes();
}

bool Statement::isNull(int column) const {
  return sqlite3_column_type(stmt_, column) == SQLITE_NULL;
}

Database::Database(const std::string& path) {
  const int opened =
      sqlite3_open_v2(path.c_str(), &db_, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE, nullptr);
  if (opened != SQLITE_OK) {
    if (opened == SQLITE_NOMEM) {
      sqlite3_close(db_);
      throw std::bad_alloc();
    }
    std::string why = db_ ? sqlite3_errmsg(db_) : "out of memory";
    sqlite3_close(db_);
    throw EngineError("cannot open the sync engine database " + path + ": " + why);
  }
  // Another process holding the database is waited for, not failed.
  sqlite3_busy_timeout(db_, 10000);
}

Database::~Database() {
  sqlite3_close(db_);
}

void Database::exec(const char* sql) {
  char* error = nullptr;
  const int done = sqlite3_exec(db_, sql, nullptr, nullptr, &error);
  if (done != SQLITE_OK) {
    std::string why = error ? error : sqlite3_errmsg(db_);
    sqlite3_free(error);
    throwIfOutOfMemory(done);
    throw EngineError(std::string("sync engine database: ") + why);
  }
}

void Database::copyFrom(const std::string& path) {
  Database source(path);
  sqlite3_backup* backup = sqlite3_backup_init(db_, "main", source.handle(), "main");
  if (!backup)
    throw EngineError(std::string("cannot copy the sync engine database: ") + sqlite3_errmsg(db_));
  const int stepped = sqlite3_backup_step(backup, -1);
  sqlite3_backup_finish(backup);
  throwIfOutOfMemory(stepped);
  if (stepped != SQLITE_DONE)
    throw EngineError("cannot copy the sync engine database " + path + ": " +
                      sqlite3_errstr(stepped));
}

Transaction::Transaction(Database& db) : db_(db) {
  db_.exec("BEGIN IMMEDIATE");
}

Transaction::~Transaction() {
  if (!done_) sqlite3_exec(db_.handle(), "ROLLBACK", nullptr, nullptr, nullptr);
}

void Transaction::commit() {
  db_.exec("COMMIT");
  done_ = true;
}

}  // namespace vtc::engine
