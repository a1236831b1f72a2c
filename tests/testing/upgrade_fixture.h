// The setting of the tests that upgrade a package and bring an earlier
// version back through kivoctl on a temporary root: a trusted root, a
// version 1.0 that writes data of every kind into its data folder and a
// version 2.0 of it, and the checks those tests share on what the data
// folder holds and what the package tool kept.
#pragma once

#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "testing/package_factory.h"
#include "testing/temp_root.h"

// A script that fills the package's data folder with files of several kinds
// and modes, a subfolder, a symlink and a hard link inside it, some with
// times set in the past.
extern const char kWriteTestData[];
// A script that changes all of that the way a migration would.
extern const char kRewriteTestData[];

class UpgradeFixture : public ::testing::Test {
 protected:
  // v1_ is test-app 1.0 whose postinst runs kWriteTestData; v2_ is the same
  // package as 2.0 with its own version.txt and no scripts.
  void SetUp() override;
  // Stops every installed package.
  void TearDown() override;

  // Installs `p` with kivoctl and the further arguments `extra`; its exit
  // status, and what it said in out_.
  int Install(const TestPackage& p, const std::vector<std::string>& extra = {});
  // Expects `words` in what kivoctl said last.
  void ExpectSaid(const std::string& words);
  // What `kivoctl status test-app` says.
  std::string Status();
  // Every entry of the data folder but a daemon's pid file: path, type,
  // mode, owner, size, times, links, link target and content digest, so
  // that two equal answers mean the same data byte for byte. The folder's
  // own entry counts unless fingerprint_folder_itself_ is false.
  std::string Fingerprint();
  // No copy of any package's data stays but `kept` earlier versions that an
  // upgrade kept, and no record or payload that neither an installed
  // package nor one of those owns.
  void ExpectNothingLeftBut(size_t kept);
  // The names in folder `dir` under the root, one a line; "" when it is not
  // there.
  std::string Entries(const std::string& dir);

  TempRoot root_;
  std::string dir_, data_, out_;
  TestPackage v1_, v2_;
  // A running daemon writes its pid file into the data folder, which
  // changes the folder's own times: a test that runs one leaves it out.
  bool fingerprint_folder_itself_ = true;
};
