#include "support/TestHome.h"

#include <stdlib.h>

#include <filesystem>

#include "VantorSyncManager/VTCPrefsCenter.h"
#include "common/Logging.h"
#include "platform/prefs/PreferenceStore.h"

namespace vtc::test {

TestHome::TestHome() {
  char tmpl[] = "/tmp/vsm-home-XXXXXX";
  path_ = mkdtemp(tmpl);
  if (const char* home = getenv("HOME")) previous_ = home;
  setenv("HOME", path_.c_str(), 1);
  unsetenv("XDG_CACHE_HOME");
  unsetenv("XDG_DATA_HOME");
  unsetenv("XDG_CONFIG_HOME");
  // Preferences, the configuration built from them and the log belong to a home.
  prefs::PreferenceStore::shared().resetForTesting();
  VTCPrefsCenter::defaultCenter().resetConfigurationForTesting();
  log::resetForTesting();
}

TestHome::~TestHome() {
  if (previous_)
    setenv("HOME", previous_->c_str(), 1);
  else
    unsetenv("HOME");
  prefs::PreferenceStore::shared().resetForTesting();
  log::resetForTesting();
  std::error_code ignored;
  std::filesystem::remove_all(path_, ignored);
}

}  // namespace vtc::test
