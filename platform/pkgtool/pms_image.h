// Images of installed packages (icons, screenshots) as the web desktop asks
// for them: by image kind, package, version and a file name.
#pragma once

#include <cstddef>

// Image kinds of installed packages (PKG_INFO_TYPE).
enum PKG_INFO_TYPE_IMAGE : int {
  PKG_INFO_TYPE_ICON = 25,        // the small icon, PACKAGE_ICON.PNG
  PKG_INFO_TYPE_ICON_256 = 26,    // the large icon, PACKAGE_ICON_256.PNG
  PKG_INFO_TYPE_SCREENSHOT = 27,  // SCREENSHOT_<n>.PNG, asked as "screenshot_<n>.png"
};

// The store of installed packages' images.
inline constexpr const char* kPMSImageStoreInstalled = "INST";

// Writes the path of `package`'s image of `kind` into `buffer` (NUL-ended)
// and answers nonzero when `package` is installed at exactly `version`
// (an image asked for another version is not the one the desktop means, and
// the desktop caches what it gets under that version for long) and the
// image exists and is readable. `store` must be "INST". `file` names what
// the caller wants: the icon kinds take any plain file name ("thumb_72.png"),
// the kind selects the member; screenshots need "screenshot_<n>.png", n 1 to
// 8. Every name is validated whole before it reaches a path. Zero, with the
// buffer untouched, in every other case, also when the path does not fit.
int PMSGetInstallImage(int kind, const char* store, const char* package, const char* version,
                       const char* file, char* buffer, size_t size);

// The screenshot number of "screenshot_<n>.png" (1 to 8), 0 for any other name.
int PMSScreenshotIndex(const char* file);
