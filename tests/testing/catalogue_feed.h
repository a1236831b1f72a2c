// A package server for tests: package files built from test sources,
// indexed by `kivoctl index` into a catalogue, served by an HttpTestServer.
// A test may change an entry (a wrong checksum, a dead link) before it
// publishes the catalogue.
#pragma once

#include <map>
#include <string>

#include <json/value.h>

#include "testing/http_test_server.h"
#include "testing/package_factory.h"

// The text of pkgserver.conf naming `vendor_url` as the vendor's catalogue,
// with a connect timeout of 2 s (a loopback server answers at once or not
// at all), then the key="value" lines of `more`.
std::string VendorConf(const std::string& vendor_url, const std::string& more = "");

class CatalogueFeed {
 public:
  // Files are built into `dir` and served under `prefix` ("/feed").
  CatalogueFeed(HttpTestServer& server, const std::string& dir, const std::string& prefix);

  // Builds `package` into the folder. Returns the file's path.
  std::string Add(const TestPackage& package);
  // Builds `package` in place of the file of the same id that the folder
  // held (removed), so the next Index() offers only this version.
  std::string Replace(const TestPackage& package);
  // Runs kivoctl index over the folder and serves every file; the catalogue
  // is then catalogue() (object form), served at Url() after Publish().
  bool Index();
  // Add(), Index() and Publish() in one: the feed offers `package` beside
  // what it offered. False when indexing failed.
  [[nodiscard]] bool Offer(const TestPackage& package);
  Json::Value& catalogue() { return catalogue_; }
  // The entry of `id` in catalogue()["packages"] (null when none).
  Json::Value& Entry(const std::string& id);
  // Serves catalogue() as it now stands at `path` (default "/catalogue.json"
  // under the prefix), or `raw` text instead.
  void Publish(const std::string& etag = "");
  void PublishRaw(const std::string& raw, int status = 200);
  std::string Url() const { return server_.Url(prefix_ + "/catalogue.json"); }
  // The route serving package file `id`, to make it misbehave.
  void SetFileRoute(const std::string& id, const HttpRoute& route);
  const std::string& FileBody(const std::string& id) { return bodies_[id]; }
  std::string FilePath(const std::string& id) const;

 private:
  HttpTestServer& server_;
  std::string dir_, prefix_;
  Json::Value catalogue_;
  std::map<std::string, std::string> bodies_;  // id -> file content
  std::map<std::string, std::string> files_;   // id -> file name
};
