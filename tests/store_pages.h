// Damage to a store file as a disk or a stray writer would do it: one page
// of a table overwritten in place.
#pragma once

#include <sqlite3.h>

#include <cstdint>
#include <fstream>
#include <string>
#include <vector>

// The leaf pages of a table (or index) in key order, read through SQLite's
// page statistics; empty when they cannot be read.
inline std::vector<int64_t> LeafPages(const std::string& db_path, const std::string& table, int64_t* page_size) {
  std::vector<int64_t> pages;
  sqlite3* db = nullptr;
  if (sqlite3_open_v2(db_path.c_str(), &db, SQLITE_OPEN_READONLY, nullptr) == SQLITE_OK) {
    sqlite3_stmt* st = nullptr;
    if (sqlite3_prepare_v2(db, "SELECT pageno FROM dbstat WHERE name = ?1 AND pagetype = 'leaf' ORDER BY path", -1,
                           &st, nullptr) == SQLITE_OK) {
      sqlite3_bind_text(st, 1, table.c_str(), -1, SQLITE_TRANSIENT);
      while (sqlite3_step(st) == SQLITE_ROW) pages.push_back(sqlite3_column_int64(st, 0));
    }
    sqlite3_finalize(st);
    if (sqlite3_prepare_v2(db, "PRAGMA page_size", -1, &st, nullptr) == SQLITE_OK && sqlite3_step(st) == SQLITE_ROW)
      *page_size = sqlite3_column_int64(st, 0);
    sqlite3_finalize(st);
  }
  sqlite3_close(db);
  return pages;
}

// Overwrites one page (numbered from 1) with a fixed pattern of garbage.
inline bool OverwritePage(const std::string& db_path, int64_t page, int64_t page_size) {
  std::fstream f(db_path, std::ios::in | std::ios::out | std::ios::binary);
  if (!f) return false;
  f.seekp((page - 1) * page_size);
  const std::string garbage(static_cast<size_t>(page_size), '\xA5');
  f.write(garbage.data(), static_cast<std::streamsize>(garbage.size()));
  return static_cast<bool>(f.flush());
}
