// `add contacts|calendars FOLDER [--dataclass NAME]` and `remove NAME`.
#include <filesystem>
#include <ostream>

#include "client/cli/Commands.h"
#include "client/run/Automation.h"
#include "client/run/Collections.h"
#include "client/run/SyncFailure.h"
#include "platform/fs/LocalPaths.h"

namespace vtc::client {

int addCommand(const std::string& kindWordGiven, const std::string& folder,
               const std::optional<std::string>& dataclass, Output& output) {
  auto kind = kindFromWord(kindWordGiven);
  if (!kind)
    throw SyncFailure(FailureKind::Usage,
                      "\"" + kindWordGiven + "\" is no kind of folder; use contacts or calendars.");
  // Before anything is made: the name becomes paths on the share and here.
  if (dataclass) requirePlainDataclassName(*dataclass);
  std::error_code error;
  // A "~" that reached us (quoted, or from a script) means the home, as in a shell.
  std::filesystem::path path = std::filesystem::absolute(paths::expandTilde(folder), error);
  if (error) throw SyncFailure(FailureKind::Usage, "\"" + folder + "\" is not a usable path.");
  path = path.lexically_normal();
  if (path.has_filename() == false) path = path.parent_path();
  if (std::filesystem::exists(path, error) && !std::filesystem::is_directory(path, error))
    throw SyncFailure(FailureKind::Usage, path.string() + " is a file, not a folder.");
  const bool made = std::filesystem::create_directories(path, error);
  if (error)
    throw SyncFailure(FailureKind::Usage,
                      "The folder " + path.string() + " cannot be made: " + error.message() + ".");
  Collection collection{
      dataclass.value_or(*kind == ItemKind::Contacts ? kDefaultContactsDataclass
                                                     : kDefaultCalendarsDataclass),
      *kind, path.string()};
  addCollection(collection);
  followAddedFolder(collection.dataclass);
  if (output.verbosity > 0)
    output.out << (made ? "Made and added " : "Added ") << collection.folder << " as "
               << collection.dataclass << ".\n";
  return 0;
}

int removeCommand(const std::string& dataclass, Output& output) {
  auto collection = configuredCollection(dataclass);
  if (!collection || !removeCollection(dataclass))
    throw SyncFailure(FailureKind::Usage, dataclass + " is not synced on this computer.");
  followRemovedFolder(dataclass);
  if (output.verbosity > 0)
    output.out << "Stopped syncing " << dataclass << "; the files in " << collection->folder
               << " stay.\n";
  return 0;
}

}  // namespace vtc::client
