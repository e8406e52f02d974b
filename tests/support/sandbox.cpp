#include "sandbox.h"

#include <velt/dev.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>

namespace fs = std::filesystem;

namespace plovo_test {

void SandboxTest::SetUp() {
  char tmpl[] = "/tmp/plovo-XXXXXX";
  ASSERT_NE(mkdtemp(tmpl), nullptr);
  root_ = tmpl;
  const char* old = std::getenv("PLOVO_ROOT");
  hadRoot_ = old != nullptr;
  if (old) oldRoot_ = old;
  setenv("PLOVO_ROOT", root_.c_str(), 1);
  VeltDevClearFaults();
}

void SandboxTest::TearDown() {
  VeltDevClearFaults();
  if (hadRoot_) {
    setenv("PLOVO_ROOT", oldRoot_.c_str(), 1);
  } else {
    unsetenv("PLOVO_ROOT");
  }
  std::error_code ec;
  fs::remove_all(root_, ec);
}

void SandboxTest::MakeDir(const std::string& systemPath) const {
  fs::create_directories(Path(systemPath));
}

void SandboxTest::WriteFile(const std::string& systemPath, const std::string& content) const {
  fs::path p(Path(systemPath));
  fs::create_directories(p.parent_path());
  std::ofstream out(p, std::ios::binary | std::ios::trunc);
  out << content;
  ASSERT_TRUE(out.good()) << p;
}

std::string SandboxTest::ReadFile(const std::string& systemPath) const {
  std::ifstream in(Path(systemPath), std::ios::binary);
  std::ostringstream s;
  s << in.rdbuf();
  return s.str();
}

bool SandboxTest::Exists(const std::string& systemPath) const {
  return fs::exists(Path(systemPath));
}

void SandboxTest::WriteStatus(int state, const std::string& error) const {
  WriteFile("/var/packages/Plovo/etc/status",
            "state=\"" + std::to_string(state) + "\"\nerror=\"" + error + "\"\n");
}

void SandboxTest::DeclareVolumes(const std::vector<Volume>& volumes) const {
  std::ostringstream json;
  json << "{\"volumes\": [";
  for (size_t i = 0; i < volumes.size(); ++i) {
    const Volume& v = volumes[i];
    json << (i ? ", " : "") << "{\"path\": \"" << v.path << "\", \"mounted\": "
         << (v.mounted ? "true" : "false") << ", \"writable\": " << (v.writable ? "true" : "false")
         << ", \"location\": \"" << v.location << "\"}";
  }
  json << "]}\n";
  WriteFile("/velt-dev/volumes.json", json.str());
}

}  // namespace plovo_test
