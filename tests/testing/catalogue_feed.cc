#include "testing/catalogue_feed.h"

#include <unistd.h>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "webapi/webapi_util.h"

std::string VendorConf(const std::string& vendor_url, const std::string& more) {
  return "vendor_url=\"" + vendor_url + "\"\nconnect_timeout=\"2\"\n" + more;
}

CatalogueFeed::CatalogueFeed(HttpTestServer& server, const std::string& dir,
                             const std::string& prefix)
    : server_(server), dir_(dir), prefix_(prefix) {
  if (KIVOFSMkdirP(dir_.c_str()) != 0) ADD_FAILURE() << "cannot create " << dir_;
}

std::string CatalogueFeed::Add(const TestPackage& package) {
  std::string path = package.Build(dir_);
  files_[package.id] = path.substr(path.rfind('/') + 1);
  return path;
}

std::string CatalogueFeed::Replace(const TestPackage& package) {
  auto old = files_.find(package.id);
  if (old != files_.end() && unlink((dir_ + "/" + old->second).c_str()) != 0)
    ADD_FAILURE() << "cannot remove " << old->second;
  return Add(package);
}

std::string CatalogueFeed::FilePath(const std::string& id) const {
  return dir_ + "/" + files_.at(id);
}

bool CatalogueFeed::Index() {
  std::string out;
  if (Kivoctl({"index", dir_, "--base-url", server_.Url(prefix_)}, &out) != 0) return false;
  std::string text;
  if (!KIVOReadFile(dir_ + "/catalogue.json", &text) || !WebAPIUtil::ParseJson(text, catalogue_))
    return false;
  for (const auto& [id, file] : files_) {
    HttpRoute route;
    if (!KIVOReadFile(dir_ + "/" + file, &route.body)) return false;
    bodies_[id] = route.body;
    server_.Set(prefix_ + "/" + file, route);
  }
  return true;
}

bool CatalogueFeed::Offer(const TestPackage& package) {
  Add(package);
  if (!Index()) return false;
  Publish();
  return true;
}

Json::Value& CatalogueFeed::Entry(const std::string& id) {
  static Json::Value none;
  for (Json::Value& e : catalogue_["packages"]) {
    if (e["package"].asString() == id) return e;
  }
  none = Json::Value();
  return none;
}

void CatalogueFeed::Publish(const std::string& etag) {
  HttpRoute route;
  route.body = catalogue_.toStyledString();
  route.etag = etag;
  server_.Set(prefix_ + "/catalogue.json", route);
}

void CatalogueFeed::PublishRaw(const std::string& raw, int status) {
  HttpRoute route;
  route.body = raw;
  route.status = status;
  server_.Set(prefix_ + "/catalogue.json", route);
}

void CatalogueFeed::SetFileRoute(const std::string& id, const HttpRoute& route) {
  HttpRoute r = route;
  if (r.body.empty()) r.body = bodies_[id];
  server_.Set(prefix_ + "/" + files_.at(id), r);
}
