// Local folders of the user: the home folder and the XDG folders that stand
// in for the caches, application-support, configuration and temporary
// folders.
#pragma once

#include <optional>
#include <string>
#include <string_view>

namespace vtc::paths {

// $HOME, or the password database's home folder when $HOME is unset.
std::string homeDirectory();

// "~" or "~/..." expanded against homeDirectory(); other paths unchanged.
std::string expandTilde(std::string_view path);

// a + "/" + b, without doubling a slash at the seam.
std::string join(std::string_view a, std::string_view b);

std::string cachesDirectory();              // $XDG_CACHE_HOME or ~/.cache
std::string applicationSupportDirectory();  // $XDG_DATA_HOME or ~/.local/share
std::string configDirectory();              // $XDG_CONFIG_HOME or ~/.config
std::string temporaryDirectory();           // $TMPDIR or /tmp

// The library's own folder, applicationSupportDirectory()/NubiloSyncClient:
// made owner-only on first use (a file in its place is removed first) and
// kept for the home it was made in. None, with a line on standard error,
// when it cannot be made.
std::optional<std::string> supportFolder();

// Creates path and its missing parents with the given mode; true when the
// folder exists afterwards.
bool makeDirectories(const std::string& path, int mode = 0755);

}  // namespace vtc::paths
