#include "platform/files.h"

#include <gtest/gtest.h>
#include <signal.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <filesystem>

#include "../../tests/temp_dir.h"
#include "platform/context.h"
#include "platform/log.h"

namespace platform {
namespace {

namespace fs = std::filesystem;

std::vector<std::string> Names(const std::string& dir) {
  std::vector<std::string> out;
  for (const auto& e : fs::directory_iterator(dir)) out.push_back(e.path().filename());
  std::sort(out.begin(), out.end());
  return out;
}

// Runs body in a child with the fault plan; returns its wait status.
template <typename F>
int InChild(const testing::FaultPlan& plan, F body) {
  const pid_t pid = fork();
  if (pid == 0) {
    testing::SetFaultPlan(plan);
    _exit(body() ? 0 : 1);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  return status;
}

TEST(FilesTest, EveryFaultPointOfAReplaceLeavesTheOldFileOrTheNew) {
  TempDir root;
  ContextScope scope(root.path());
  const std::string path = root / "var/a/file";
  ASSERT_TRUE(WriteFileAtomically(path, "old"));
  testing::SetFaultPlan({});
  ASSERT_TRUE(WriteFileAtomically(path, "new"));
  const uint64_t points = testing::FaultPointsPassed();
  EXPECT_EQ(points, 5u);  // create, write, fsync, rename, directory fsync
  ASSERT_TRUE(WriteFileAtomically(path, "old"));

  for (uint64_t at = 1; at <= points; ++at) {
    SCOPED_TRACE(at);
    using Kind = testing::FaultPlan::Kind;
    const int crashed = InChild({Kind::kCrash, at, 0}, [&] { return WriteFileAtomically(path, "new"); });
    ASSERT_TRUE(WIFSIGNALED(crashed) && WTERMSIG(crashed) == SIGKILL);
    const std::string after_crash = *ReadFile(path);
    EXPECT_EQ(after_crash, at <= 4 ? "old" : "new");  // killed before the call it stands at
    ASSERT_TRUE(WriteFileAtomically(path, "old"));

    const int failed = InChild({Kind::kFail, at, ENOSPC}, [&] { return WriteFileAtomically(path, "new"); });
    ASSERT_TRUE(WIFEXITED(failed));
    EXPECT_EQ(WEXITSTATUS(failed), 1);  // reported, even when only the directory's sync failed
    EXPECT_EQ(*ReadFile(path), at <= 4 ? "old" : "new");
    ASSERT_TRUE(WriteFileAtomically(path, "old"));
  }
  // A failed write leaves no temporary file; a killed one leaves one the
  // next run recognises.
  for (const std::string& name : Names(root / "var/a"))
    EXPECT_TRUE(name == "file" || IsLeftoverTempName(name)) << name;
}

TEST(FilesTest, ModesLinksAndTheThingsInTheWay) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{nullptr, log});
  const mode_t old_mask = umask(0);
  ASSERT_TRUE(WriteFileAtomically(root / "d/e/f", "x"));
  ASSERT_TRUE(AppendToFile(root / "d/g", "y"));
  ASSERT_TRUE(WriteFileAtomically(root / "d/lib", "z", nullptr, 0755));
  umask(old_mask);
  struct stat st;
  for (const auto& [rel, mode] : std::vector<std::pair<std::string, mode_t>>{
           {"d", 0700}, {"d/e", 0700}, {"d/e/f", 0600}, {"d/g", 0600}, {"d/lib", 0700}}) {
    ASSERT_EQ(stat((root / rel).c_str(), &st), 0) << rel;
    EXPECT_EQ(st.st_mode & 07777, mode) << rel;
  }

  // Below the root no link is followed, whether it names the file or a
  // directory on the way; the root itself may be a link.
  TempDir outside;
  fs::create_symlink(outside / "t", root / "d/link");
  fs::create_directory_symlink(outside.path(), root / "d/dirlink");
  std::string error;
  EXPECT_FALSE(AppendToFile(root / "d/link", "x", &error));
  EXPECT_EQ(error, root / "d/link is a symbolic link; refusing to write through it");
  EXPECT_FALSE(WriteFileAtomically(root / "d/link", "x", &error));
  EXPECT_EQ(error, root / "d/link is a symbolic link; refusing to replace it");
  EXPECT_FALSE(WriteFileAtomically(root / "d/dirlink/f", "x", &error));
  EXPECT_EQ(error, "cannot create " + (root / "d/dirlink") + ": Too many levels of symbolic links");
  EXPECT_FALSE(MakeDirectories(root / "d/dirlink/sub"));
  EXPECT_EQ(errno, ELOOP);
  EXPECT_TRUE(fs::is_empty(outside.path()));
  fs::create_directory_symlink(root.path(), outside / "root-link");
  {
    ContextScope linked(outside / "root-link");
    EXPECT_TRUE(WriteFileAtomically(outside / "root-link/d/through-root", "ok"));
  }
  EXPECT_EQ(*ReadFile(root / "d/through-root"), "ok");

  // Whatever stands in the way is named with the real cause.
  ASSERT_TRUE(WriteFileAtomically(root / "plain", "a file"));
  EXPECT_FALSE(WriteFileAtomically(root / "plain/f", "x", &error));
  EXPECT_EQ(error, "cannot create " + (root / "plain") + ": Not a directory");
  EXPECT_FALSE(MakeDirectories(root / "plain/sub"));
  EXPECT_EQ(errno, ENOTDIR);
  EXPECT_FALSE(WriteFileAtomically(root / "d/../escape", "x", &error));
  ASSERT_EQ(mkfifo((root / "d/fifo").c_str(), 0600), 0);
  EXPECT_FALSE(AppendToFile(root / "d/fifo", "x", &error));  // and it does not block
  EXPECT_EQ(error, root / "d/fifo is not a regular file; refusing to write to it");

  // Writing over a file in place: only over a regular file at least as
  // long, never through a link, and the tail stays.
  auto d = Directory::Open(root / "d", false, &error);
  ASSERT_TRUE(d);
  ASSERT_TRUE(WriteFileAtomically(root / "d/over", "0123456789"));
  EXPECT_TRUE(d->Overwrite("over", "abc", &error)) << error;
  EXPECT_EQ(*ReadFile(root / "d/over"), "abc3456789");
  EXPECT_FALSE(d->Overwrite("over", "longer than ten", &error));
  EXPECT_EQ(error, root / "d/over is not a regular file long enough to be written over");
  EXPECT_FALSE(d->Overwrite("link", "x", &error));
  EXPECT_EQ(error, "cannot open " + (root / "d/link") + ": Too many levels of symbolic links");
  EXPECT_FALSE(d->Overwrite("fifo", "", &error));
  EXPECT_FALSE(d->Overwrite("missing", "x", &error));
  EXPECT_FALSE(fs::exists(outside / "t"));
}

TEST(FilesTest, AppendedLinesAreWholeOrAbsent) {
  TempDir root;
  auto log = std::make_shared<CaptureLog>();
  ContextScope scope(root.path(), Backends{nullptr, log});
  const std::string path = root / "var/lines.jsonl";
  // A torn line left by someone else is cut off before the next one; a
  // file of nothing but a fragment is emptied.
  for (const auto& [before, after] : std::vector<std::pair<std::string, std::string>>{
           {"one\ntw", "one\nnext\n"}, {"fragment", "next\n"}, {"", "next\n"}, {"one\n", "one\nnext\n"}}) {
    ASSERT_TRUE(WriteFileAtomically(path, before));
    EXPECT_TRUE(AppendToFile(path, "next\n"));
    EXPECT_EQ(*ReadFile(path), after) << before;
  }
  EXPECT_EQ(log->Count(path + " ended in 2 bytes of a torn line; they were cut off"), 1u);
  EXPECT_EQ(log->Count(path + " ended in 8 bytes of a torn line; they were cut off"), 1u);

  // A write cut short (here by a file size limit, as a full disk would) is
  // taken back whole.
  ASSERT_TRUE(WriteFileAtomically(path, "one\n"));
  const pid_t pid = fork();
  if (pid == 0) {
    signal(SIGXFSZ, SIG_IGN);
    const rlimit limit{10, 10};
    std::string error;
    _exit(setrlimit(RLIMIT_FSIZE, &limit) == 0 && !AppendToFile(path, "a line too long\n", &error) &&
                  error == "cannot write " + path + ": No space left on device"
              ? 0
              : 1);
  }
  int status = 0;
  waitpid(pid, &status, 0);
  EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  EXPECT_EQ(*ReadFile(path), "one\n");

  // A line marked as one of a kind is not appended when the file's tail
  // holds its mark; only the tail is searched.
  AppendOnce once{"\"id\":\"7\""};
  EXPECT_TRUE(AppendToFile(path, "{\"id\":\"7\"}\n", nullptr, &once));
  EXPECT_FALSE(once.present);
  EXPECT_TRUE(AppendToFile(path, "{\"id\":\"7\"}\n", nullptr, &once));
  EXPECT_TRUE(once.present);
  AppendOnce near{"\"id\":\"7\"", 4};
  EXPECT_TRUE(AppendToFile(path, "{\"id\":\"7\"}\n", nullptr, &near));
  EXPECT_FALSE(near.present);
  EXPECT_EQ(*ReadFile(path), "one\n{\"id\":\"7\"}\n{\"id\":\"7\"}\n");
}

TEST(FilesTest, LeftoverNamesAndTheInstanceLock) {
  for (const auto& [name, leftover] : std::vector<std::pair<std::string, bool>>{
           {".x.plist.tmp.Ab3dE9", true}, {"x.plist.tmp.Ab3dE9", true}, {".submission.k2LmN0", true},
           {".submission.tmp.k2LmN0", true}, {"x.plist", false}, {"x.tmp.abc", false}, {".tmp.abcdefg", false},
           {"log.tmp.ab-def", false}, {".submission.json", false}}) {
    EXPECT_EQ(IsLeftoverTempName(name), leftover) << name;
  }

  TempDir root;
  ContextScope scope(root.path());
  std::string error;
  auto first = FileLock::Acquire(root / "var/run/lock", FileLock::Wait::kTry, &error);
  ASSERT_TRUE(first) << error;
  // flock locks belong to the open file, so a second open in this process
  // is turned away as another process would be.
  EXPECT_FALSE(FileLock::Acquire(root / "var/run/lock", FileLock::Wait::kTry, &error));
  EXPECT_EQ(error, "");  // busy, not broken
  first.reset();
  EXPECT_TRUE(FileLock::Acquire(root / "var/run/lock", FileLock::Wait::kTry, &error));
}

}  // namespace
}  // namespace platform
