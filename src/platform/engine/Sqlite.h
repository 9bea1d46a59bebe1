// Thin RAII over SQLite: a connection and prepared statements whose errors
// raise EngineError with SQLite's own words, except SQLite running out of
// memory, which raises std::bad_alloc.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <string>

#include "VantorSyncManager/Value.h"
#include "platform/engine/SyncEngine.h"

namespace vtc::engine {

class Statement {
 public:
  Statement(sqlite3* db, const char* sql);
  ~Statement();
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;

  Statement& bind(int index, const std::string& text);
  Statement& bind(int index, int64_t number);
  Statement& bind(int index, double number);
  Statement& bind(int index, const Bytes& blob);
  // Steps once: true while a row is available.
  bool step();
  // Steps a statement that returns no rows.
  void run();
  void reset();

  int64_t integer(int column) const;
  double real(int column) const;
  std::string text(int column) const;
  Bytes blob(int column) const;
  bool isNull(int column) const;

 private:
  sqlite3* db_;
  sqlite3_stmt* stmt_ = nullptr;
};

class Database {
 public:
  explicit Database(const std::string& path);
  ~Database();
  sqlite3* handle() const { return db_; }
  void exec(const char* sql);
  // Replaces this database's content with a copy of the database at path.
  void copyFrom(const std::string& path);

 private:
  sqlite3* db_ = nullptr;
};

// BEGIN IMMEDIATE ... COMMIT, rolled back when left by an exception.
class Transaction {
 public:
  explicit Transaction(Database& db);
  ~Transaction();
  void commit();

 private:
  Database& db_;
  bool done_ = false;
};

}  // namespace vtc::engine
