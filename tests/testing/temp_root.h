// A system root of its own for one test: created with the same code as
// `kivoctl init-root`, pointed at by KIVO_ROOT, removed afterwards.
#pragma once

#include <string>
#include <vector>

class TempRoot {
 public:
  TempRoot();
  ~TempRoot();
  TempRoot(const TempRoot&) = delete;
  TempRoot& operator=(const TempRoot&) = delete;

  const std::string& dir() const { return dir_; }
  // "<root>" + fixed.
  std::string Path(const std::string& fixed) const { return dir_ + fixed; }
  // Writes a file under the root, creating its folders.
  void Write(const std::string& fixed, const std::string& content) const;
  void AddAccount(const std::string& name, const std::string& password,
                  const std::vector<std::string>& groups) const;

 private:
  std::string dir_;
};

// How many entries of folder `dir` have a name starting with `prefix` (0 when
// the folder cannot be read): what an operation left behind.
int CountEntries(const std::string& dir, const std::string& prefix);

// What the package tool's data copies folder of a volume holds
// ("<root>/<volume>/@appdata/.snapshots"): every entry as "<id>/<name>",
// and how many of them are kept earlier versions ("<record>.kept"), each of
// which keeps its record and payload too. An upgrade or a rollback that
// ended leaves nothing else there.
struct DataCopies {
  std::vector<std::string> entries;
  size_t kept = 0;
};
DataCopies ListDataCopies(const std::string& snapshots_dir);

// The whole content of file `path`; "" when it cannot be read.
std::string FileText(const std::string& path);

// The build tree (KIVO_BUILD_DIR, set by ctest).
std::string BuildDir();
// For programs run outside ctest (benchmarks): the build tree is the folder
// above the one this program lies in, unless KIVO_BUILD_DIR says otherwise.
void UseBuildDirOfThisProgram();
