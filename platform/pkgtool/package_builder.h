// Building and signing package files (docs/package-format.md), for package
// authors through `kivoctl build` and `kivoctl sign`.
#pragma once

#include <map>
#include <string>

struct BuildOptions {
  int compression_level = 6;  // gzip level of package.tgz, 1 (fast) to 9 (small)
};

// Builds a package file at `output` from the source folder `source`:
//   INFO                 required
//   package/             the payload, becomes package.tgz
//   scripts/...          preinst, postinst, ..., start-stop-status
//   WIZARD_UIFILES/...   install_uifile[_lang], upgrade_..., uninstall_... (JSON)
//   LICENSE, PACKAGE_ICON.PNG, PACKAGE_ICON_256.PNG, CHANGELOG (release notes)
// A file that cannot be opened or read, or changes while it is read, fails
// the build, and so does a result the package-file reader would refuse.
// Returns false with `*error` telling the author exactly what is wrong; no
// new output file is left then.
[[nodiscard]] bool PMSBuildPackage(const std::string& source, const std::string& output,
                                   const BuildOptions& options, std::string* error);

// Writes a package file from its parts: `members` (INFO and the other
// non-payload members, by name) and an existing package.tgz. MANIFEST is
// computed; `signature` ("" for none) is stored as signature.asc as given.
// Nothing is checked beyond that (tests use it to write what the builder
// never would).
[[nodiscard]] bool PMSWritePackage(const std::map<std::string, std::string>& members,
                                   const std::string& payload_path, const std::string& signature,
                                   const std::string& output, std::string* error);

// Writes a signed copy of the package file `input` to `output` (they may be
// the same path), signed with `key` of the GnuPG home `gnupg_home`.
[[nodiscard]] bool PMSSignPackage(const std::string& input, const std::string& output,
                                  const std::string& gnupg_home, const std::string& key,
                                  std::string* error);

// Like PMSSignPackage with a detached signature made elsewhere (over the
// package's MANIFEST, which `kivoctl inspect` shows).
[[nodiscard]] bool PMSAttachSignature(const std::string& input, const std::string& output,
                                      const std::string& signature, std::string* error);
