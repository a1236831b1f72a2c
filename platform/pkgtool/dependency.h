// Package dependencies, conflicts and required services.
//
// Dependency and conflict strings (INFO "install_dep_packages",
// "install_conflict_packages") list entries separated by ':', each a
// package id, optionally followed by an operator and a version:
//     demo-web>=1.0:demo-lib:old-tool<2
// Operators: = > >= < <= != (see version.h). An entry without one matches
// any version.
//
// The JSON form (what toJSON writes and PMSParseDepJSONString reads) is an
// object {"<id>": {"operator": ">=", "version": "1.0"}, "<id2>": {}}; a JSON
// string in the text syntax above is read as well.
//
// Service strings (INFO "install_dep_services") name system services
// separated by ':' or spaces: "pgsql:web".
#pragma once

#include <set>
#include <string>
#include <vector>

#include <json/value.h>

#include "pkgtool/version.h"

// A package id with a version, or with a version constraint.
class PackageBasicInfo {
 public:
  PackageBasicInfo() = default;
  PackageBasicInfo(std::string name, std::string version)
      : name_(std::move(name)), version_(std::move(version)) {}
  PackageBasicInfo(std::string name, PKG_VERSION_COMPOP op, std::string version)
      : name_(std::move(name)), version_(std::move(version)), op_(op), constrained_(true) {}

  const std::string& getName() const { return name_; }
  const std::string& getVersion() const { return version_; }
  PKG_VERSION_COMPOP getOperator() const { return op_; }
  bool hasConstraint() const { return constrained_; }

  // True when this version `op` other's version (compare(x, PKG_VER_LT):
  // this one is lower than x).
  bool compare(const PackageBasicInfo& other, PKG_VERSION_COMPOP op) const {
    return PMSVersionMatches(version_, op, other.version_);
  }
  // True when `version` satisfies this entry's constraint (any, without one).
  bool accepts(const std::string& version) const {
    return !constrained_ || PMSVersionMatches(version, op_, version_);
  }
  // "demo-web>=1.0" or "demo-web".
  std::string toString() const;

 private:
  std::string name_;
  std::string version_;
  PKG_VERSION_COMPOP op_ = PKG_VER_EQ;
  bool constrained_ = false;
};

class DepPkgVector : public std::vector<PackageBasicInfo> {
 public:
  // The JSON form (object keyed by id) into `out`.
  void toJSON(Json::Value& out) const;
  // "a>=1:b", the text form.
  std::string toString() const;
};

// Parses the text form. Entries with an invalid id, operator or version are
// skipped; returns the number of entries kept.
int PMSExplodeDepPKGString(const std::string& text, DepPkgVector& out);
// Parses the JSON form (or a JSON string holding the text form).
int PMSParseDepJSON(const Json::Value& value, DepPkgVector& out);
// Parses JSON text with PMSParseDepJSON; 0 entries when it is not JSON.
int PMSParseDepJSONString(const std::string& text, DepPkgVector& out);

// Service names of a service string, in set order; invalid names dropped.
std::set<std::string> PMSServiceSet(const std::string& text);

// The services with a bit of their own in service masks, in bit order.
const std::vector<std::string>& PMSKnownServices();
// Bit mask of the known services named in `text` (unknown names add nothing).
unsigned PMSServiceMask(const std::string& text);
