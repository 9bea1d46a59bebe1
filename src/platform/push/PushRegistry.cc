#include "platform/push/PushRegistry.h"

#include <unistd.h>

#include "platform/fs/LocalPaths.h"
#include "platform/plist/PlistCodec.h"

namespace vtc::push {

namespace {

std::vector<std::string> strings(const Value& array) {
  std::vector<std::string> out;
  for (const Value& v : array.array()) out.push_back(v.string());
  return out;
}

}  // namespace

std::optional<std::string> registrationsFile() {
  std::optional<std::string> folder = paths::supportFolder();
  if (!folder) return std::nullopt;
  return paths::join(*folder, "PushRegistrations.plist");
}

std::optional<Registrations> readRegistrations() {
  std::optional<std::string> file = registrationsFile();
  if (!file) return std::nullopt;
  Registrations r;
  if (::access(file->c_str(), F_OK) != 0) return r;
  std::optional<Value> all = plist::readFile(*file);
  if (!all || !all->isDictionary()) return std::nullopt;
  for (const Value& l : all->dictionary().get("Launchables").array()) {
    const Dictionary& d = l.dictionary();
    r.launchables.push_back(
        {d.get("Tool").string(), d.get("Topic").string(), strings(d.get("Arguments"))});
  }
  for (const Value& s : all->dictionary().get("OnLoadSessions").array()) {
    const Dictionary& d = s.dictionary();
    r.onLoadSessions.push_back({d.get("Account").string(), d.get("Domain").string(),
                                d.get("AccountPlaceholder").string(), d.get("Service").string()});
  }
  return r;
}

bool writeRegistrations(const Registrations& registrations) {
  std::optional<std::string> file = registrationsFile();
  if (!file) return false;
  Array launchables, sessions;
  for (const Launchable& l : registrations.launchables) {
    Array arguments;
    for (const std::string& a : l.arguments) arguments.push_back(Value(a));
    launchables.push_back(Value(Dictionary{
        {"Tool", Value(l.tool)}, {"Topic", Value(l.topic)}, {"Arguments", Value(arguments)}}));
  }
  for (const OnLoadSession& s : registrations.onLoadSessions)
    sessions.push_back(Value(Dictionary{{"Account", Value(s.account)},
                                        {"Domain", Value(s.domain)},
                                        {"AccountPlaceholder", Value(s.accountPlaceholder)},
                                        {"Service", Value(s.service)}}));
  return plist::writeFileAtomically(
      *file,
      Value(Dictionary{{"Launchables", Value(launchables)}, {"OnLoadSessions", Value(sessions)}}),
      0600);
}

}  // namespace vtc::push
