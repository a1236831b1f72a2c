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
  uint64_t extract_limit = 0;                  // bytes INFO's extractsize allows unpacked
};

class PackageFileReader {
 public:
  PackageFileReader();
  ~PackageFileReader();
  PackageFileReader(const PackageFileReader&) = delete;
  PackageFileReader& operator=(const PackageFileReader&) = delete;

  // Opens `path` and reads every member up to the payload, checking each
  // against MANIFEST, then INFO. Returns PKG_OK or a result code with
  // `*error` saying what was wrong:
  //   261  not a package file: damaged or cut short, a member missing or
  //        too large, MANIFEST malformed, an INFO field invalid (a path,
  //        version, dependency, extractsize missing or not a number, ...)
  //   262  INFO's package id breaks the id rule (PMSIsValidPackageId)
  //   277  a member that is not allowed: escapes, is not a plain file, or
  //        is the second of its name (also a name MANIFEST lists twice)
  //   289  a member that does not match MANIFEST, one MANIFEST lists that
  //        is missing, or one it does not list
  //   293  a newer format
  // The digests are compared before INFO is judged, so a member changed
  // after signing is 289 whatever it now says. After a 289, header() still
  // holds the members as read and INFO when it passes its rules (else an
  // empty INFO), so that the file can be described while it is refused;
  // none of it is vouched for, and the payload is not to be read.
  [[nodiscard]] int Open(const std::string& path, std::string* error);
  const PackageFileHeader& header() const { return header_; }

  // What ReadPayload does with the payload's entries.
  enum class Payload { Check, Extract };

  // Streams the payload: every entry is checked before anything is done with
  // it (relative paths that stay inside, each path once, no hard links,
  // device nodes, fifos or setuid/setgid bits, symlinks that point inside,
  // and all of them together within header().extract_limit); with Extract
  // it is written under `dest`, an existing empty folder, never following a
  // symlink, with its permission bits (owner read/write, and enter for
  // folders, added). Nothing may follow package.tgz in the package file.
  // `progress` gets the fraction read so far. Returns PKG_OK or a code with
  // `*error` set; the payload's digest decides first:
  //   261  the package file is cut short or damaged around the payload
  //   289  package.tgz does not match MANIFEST
  //   276  the payload is not a readable tar.gz, or a file cannot be written
  //   277  an entry that is not allowed, a payload larger than extractsize
  //        declares, or a member after package.tgz
  //   279  the volume is full
  // After a failure `dest` holds a partial tree for the caller to remove.
  [[nodiscard]] int ReadPayload(Payload mode, const std::string& dest,
                                const std::function<void(double)>& progress, std::string* error);

 private:
  int ReadMember(const std::string& name, int64_t size, std::string* error);
  int ReadHeaderMembers(std::string* error);
  int VerifyManifest(std::string* error) const;
  int ReadInfo(std::string* error);
  // PKG_OK when the release notes (CHANGELOG), if any, keep their rules
  // (release_notes.h); else 261.
  int CheckReleaseNotes(std::string* error) const;

  struct archive* outer_ = nullptr;
  PackageFileHeader header_;
  bool at_payload_ = false;
};

// Hex SHA-256 of `data`.
[[nodiscard]] std::string PMSSha256Hex(const std::string& data);

// The names a package file may hold besides the payload.
bool PMSIsPackageMemberName(const std::string& name);

// The room one payload entry takes unpacked, as extractsize counts it: a
// regular file its size in whole 4 KiB blocks (at least one), any other
// entry one block. The builder declares the sum, the reader enforces it.
uint64_t PMSPayloadEntryBytes(bool regular_file, uint64_t size);

// libarchive's text for the last error of `a`; never null, since libarchive
// leaves it unset for some failures (a read callback's error, a cut-short
// stream).
std::string PMSArchiveError(struct archive* a);
