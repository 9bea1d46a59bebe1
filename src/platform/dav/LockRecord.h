// The record that a lock's holder keeps beside its lock, as a dead property
// of the locked resource, on a server whose lock discovery falls short (one
// that drops the lock's owner, or keeps a lock longer than asked): the
// lock's token, the owner text the LOCK carried, and when the lock ends by
// the time-out asked for, in the server's time. Other clients read it to
// learn who holds the lock, and to give back a lock that the server kept
// past that time. The holder removes it before unlocking.
#pragma once

#include <ctime>
#include <optional>
#include <string>
#include <string_view>

namespace vtc {

// The record's property: namespace and local name, and the full name.
inline constexpr const char* kLockRecordNamespace = "urn:x-vantor:dav:";
inline constexpr const char* kLockRecordName = "lockrecord";
inline constexpr const char* kLockRecordProperty = "urn:x-vantor:dav:lockrecord";

struct LockRecord {
  std::string token;
  std::time_t expires = 0;  // server time
  std::string owner;        // the owner XML, whole

  // "token\nexpires\nowner"
  std::string text() const;
  // Nothing when the text is not a record.
  static std::optional<LockRecord> parse(std::string_view text);
};

// The server's time of an answer, from its Date header; nothing when the
// header is missing or unreadable.
std::optional<std::time_t> serverTime(const std::string& dateHeader);

}  // namespace vtc
