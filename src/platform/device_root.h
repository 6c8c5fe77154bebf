// What makes a directory a device root. Every tool checks it before it
// changes anything: a mistyped TALLYRUN_ROOT must never turn some other
// directory into a root, be emptied, or have its modes tightened.
#pragma once

#include <string>

namespace platform {

// The file `devsim init` writes at the top of every root it makes.
inline constexpr const char* kRootMarkerName = ".tallyrun-root";

enum class RootStatus {
  kRoot,           // a root: its marker, or (made before markers) its store
  kMissing,        // nothing there
  kNotADirectory,  // a file or something else stands there
  kUnreadable,     // a directory this user may not read
  kProtected,      // "/" or the home directory: never a root
  kNotARoot,       // a directory without the marker and without a store
};

struct RootCheck {
  RootStatus status = RootStatus::kMissing;
  // For everything but kRoot: what is wrong and how to make a root, in one
  // line without the program's name.
  std::string message;
  bool ok() const { return status == RootStatus::kRoot; }
};

// Whether dir is a device root that the job may use.
RootCheck CheckDeviceRoot(const std::string& dir);

// True when dir carries the marker (a regular file, not a link).
bool HasRootMarker(const std::string& dir);
// Writes the marker into dir, creating dir when missing.
bool WriteRootMarker(const std::string& dir, std::string* error);

// "/" and the home directory (of $HOME and of this user): directories that
// no tool empties, re-modes or takes for a root, whatever they hold.
bool IsProtectedDirectory(const std::string& dir);

}  // namespace platform
