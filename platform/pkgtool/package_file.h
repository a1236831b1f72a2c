// Reading package files (docs/package-format.md): an uncompressed tar
// archive whose members are INFO, MANIFEST, an optional signature.asc, the
// scripts, wizard files, licence and icons, and last the payload package.tgz.
//
// MANIFEST lists the SHA-256 digest of every other member (signature.asc
// aside); signature.asc is a detached OpenPGP signature over MANIFEST. So the
// signature is checked before the payload is touched, and the payload's
// digest is checked while it streams.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <string>

#include "klibc/key_value_file.h"

struct archive;

// The members before the payload, as read.
struct PackageFileHeader {
  KeyValueMap info;
  std::string manifest;                        // MANIFEST as read
  std::string signature;                       // signature.asc, "" when unsigned
  std::map<std::string, std::string> members;  // scripts, wizards, licence, icons
  std::map<std::string, std::string> digests;  // MANIFEST: member name -> hex SHA-256
  uint64_t payload_size = 0;                   // bytes of package.tgz
};

class PackageFileReader {
 public:
  PackageFileReader();
  ~PackageFileReader();
  PackageFileReader(const PackageFileReader&) = delete;
  PackageFileReader& operator=(const PackageFileReader&) = delete;

  // Opens `path` and reads every member up to the payload, checking each
  // against MANIFEST. Returns PKG_OK or a result code (261 not a package
  // file, 277 a member that is not allowed, 289 a member that does not match
  // MANIFEST, 293 a newer format), with `*error` saying what was wrong.
  int Open(const std::string& path, std::string* error);
  const PackageFileHeader& header() const { return header_; }

  // What ReadPayload does with the payload's entries.
  enum class Payload { Check, Extract };

  // Streams the payload: every entry is checked before anything is done with
  // it (relative paths that stay inside, no hard links, device nodes, fifos
  // or setuid/setgid bits, symlinks that point inside); with Extract it is
  // written under `dest`, an existing empty folder, never following a
  // symlink. The payload's digest must match MANIFEST. `progress` gets the
  // fraction read so far. Returns PKG_OK or a code (276, 277, 279, 289) with
  // `*error` set; after a failure `dest` holds a partial tree for the caller
  // to remove.
  int ReadPayload(Payload mode, const std::string& dest,
                  const std::function<void(double)>& progress, std::string* error);

 private:
  int ReadMember(const std::string& name, int64_t size, std::string* error);

  struct archive* outer_ = nullptr;
  PackageFileHeader header_;
  bool at_payload_ = false;
};

// Hex SHA-256 of `data`.
std::string PMSSha256Hex(const std::string& data);

// The names a package file may hold besides the payload.
bool PMSIsPackageMemberName(const std::string& name);
