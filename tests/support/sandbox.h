// Test fixtures shared by every suite.
//
// SandboxTest gives each test a fresh sandbox root: a new folder under /tmp
// (short, so that socket paths fit), PLOVO_ROOT set to it, removed with its
// contents after the test. Paths given to the helpers are system paths
// ("/var/packages/Plovo/etc/status") and are placed under the root.
#ifndef PLOVO_TESTS_SUPPORT_SANDBOX_H
#define PLOVO_TESTS_SUPPORT_SANDBOX_H

#include <gtest/gtest.h>

#include <cstdint>
#include <string>
#include <vector>

namespace plovo_test {

// One volume of the development platform's configuration
// (velt-dev/volumes.json, docs/platform.md).
struct Volume {
  std::string path;                 // relative paths lie under the root
  bool mounted = true;
  bool writable = true;
  std::string location = "internal";  // "internal" or "external"
};

class SandboxTest : public ::testing::Test {
 protected:
  void SetUp() override;
  void TearDown() override;

  const std::string& Root() const { return root_; }
  std::string Path(const std::string& systemPath) const { return root_ + systemPath; }

  void MakeDir(const std::string& systemPath) const;
  void WriteFile(const std::string& systemPath, const std::string& content) const;
  std::string ReadFile(const std::string& systemPath) const;
  bool Exists(const std::string& systemPath) const;

  // Writes the status file as the daemon and service control do.
  void WriteStatus(int state, const std::string& error) const;
  // Replaces the platform's volume list.
  void DeclareVolumes(const std::vector<Volume>& volumes) const;

 private:
  std::string root_;
  std::string oldRoot_;
  bool hadRoot_ = false;
};

}  // namespace plovo_test

#endif
