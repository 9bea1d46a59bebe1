// A fresh temporary $HOME for the life of the object.
#pragma once

#include <optional>
#include <string>

namespace vtc::test {

class TestHome {
 public:
  TestHome();
  ~TestHome();
  const std::string& path() const { return path_; }

 private:
  std::string path_;
  std::optional<std::string> previous_;
};

}  // namespace vtc::test
