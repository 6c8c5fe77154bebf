// File helpers behind the seam: whole-file reads and atomic replacement.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

namespace platform {

// The whole file, or nothing when it cannot be read (reason in *error).
std::optional<std::string> ReadFile(const std::string& path, std::string* error = nullptr);

// Creates the directory and its parents (mode 0755). True when it exists;
// otherwise errno says why (ENOTDIR when a file stands in the way).
bool MakeDirectories(const std::string& path);

// Replaces path with bytes so that a reader sees the old file or the new one,
// never a mix: temp file in the same directory, fsync, rename, fsync of the
// directory. Creates missing parent directories. On failure the old file is
// untouched and no temp file is left behind.
bool WriteFileAtomically(const std::string& path, std::string_view bytes, std::string* error = nullptr,
                         int mode = 0644);

bool FileExists(const std::string& path);
// The size of a file in bytes (stat), or nothing when it cannot be stat'ed.
std::optional<int64_t> FileSize(const std::string& path);

namespace testing {
// Called after the temp file is complete and synced, before the rename; a
// test sets it to simulate a crash at the worst moment.
extern void (*g_before_rename_hook)(const std::string& temp_path);
}  // namespace testing

}  // namespace platform
