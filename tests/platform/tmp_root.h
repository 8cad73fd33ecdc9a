// A throw-away appliance root for platform tests: a temporary directory that
// ORVI_ROOT points at for the lifetime of the object.
#ifndef TC_TESTS_PLATFORM_TMP_ROOT_H
#define TC_TESTS_PLATFORM_TMP_ROOT_H

#include <stdlib.h>

#include <filesystem>
#include <fstream>
#include <string>

#include <gtest/gtest.h>

class TmpRoot {
 public:
  TmpRoot() {
    std::string tmpl = (std::filesystem::temp_directory_path() / "orvi-root-XXXXXX").string();
    if (mkdtemp(&tmpl[0]) == nullptr) ADD_FAILURE() << "mkdtemp failed";
    dir_ = tmpl;
    setenv("ORVI_ROOT", dir_.c_str(), 1);
  }
  ~TmpRoot() {
    unsetenv("ORVI_ROOT");
    std::error_code ec;
    std::filesystem::remove_all(dir_, ec);
  }
  TmpRoot(const TmpRoot&) = delete;
  TmpRoot& operator=(const TmpRoot&) = delete;

  const std::string& Dir() const { return dir_; }
  // rel is relative to the root ("etc/x").
  std::string Path(const std::string& rel) const { return dir_ + "/" + rel; }
  void MkDir(const std::string& rel) const { std::filesystem::create_directories(Path(rel)); }
  void Write(const std::string& rel, const std::string& text) const {
    std::filesystem::create_directories(std::filesystem::path(Path(rel)).parent_path());
    std::ofstream(Path(rel), std::ios::binary) << text;
  }
  bool Exists(const std::string& rel) const { return std::filesystem::exists(Path(rel)); }

 private:
  std::string dir_;
};

#endif
