#include "sim/kcdata.h"

#include <gtest/gtest.h>

#include "parsers/kcdata.h"

namespace {

using sim::KCDataBuilder;

std::string Hex(const std::string& bytes) {
  static const char kDigits[] = "0123456789abcdef";
  std::string out;
  for (unsigned char c : bytes) {
    out += kDigits[c >> 4];
    out += kDigits[c & 15];
  }
  return out;
}

cf::Dictionary Thread(const char* name, cf::Value writes = cf::Value()) {
  cf::Dictionary d;
  d.Set("name", name);
  if (!writes.IsNull()) d.Set("diskWrites", writes);
  return d;
}

cf::Dictionary Task(cf::Value name, std::vector<cf::Value> threads) {
  cf::Dictionary d;
  d.Set("name", name);
  d.Set("threads", cf::Array(std::move(threads)));
  return d;
}

uint64_t Writes(const std::string& bytes, int* found) {
  const void* stats = nullptr;
  *found = getIOStatsWithThreadnameFromKCData(bytes.data(), bytes.data() + bytes.size(), "VM_swapout", &stats);
  return KCDataDiskWriteBytes(stats);
}

TEST(KCDataEncoderTest, ItemBytes) {
  EXPECT_EQ(Hex(KCDataBuilder().Begin(0x0102030405060708, 3).bytes()),
            "13000000" "04000000" "0807060504030201" "03000000");
  EXPECT_EQ(Hex(KCDataBuilder().End(9).bytes()), "14000000" "00000000" "0900000000000000");
  EXPECT_EQ(Hex(KCDataBuilder().BufferEnd().bytes()), "ed5891f1" "00000000" "0000000000000000");
  EXPECT_EQ(Hex(KCDataBuilder().ThreadName("VM", 4).bytes()), "09090000" "04000000" "0000000000000000" "564d0000");
  EXPECT_EQ(Hex(KCDataBuilder().ThreadName("VM_swapout", 2).bytes()).substr(8, 8), "0a000000");
  EXPECT_EQ(KCDataBuilder().TaskName("launchd").size(), 16u + 64u);
  EXPECT_EQ(Hex(KCDataBuilder().IOStats(0x1122334455667788).bytes()),
            "01090000" "20000000" "0000000000000000" + std::string(48, '0') + "8877665544332211");
  EXPECT_EQ(Hex(KCDataBuilder().Header(0x20, 0xFFFFFFFF, 1).Bytes("z").bytes()),
            "20000000" "ffffffff" "0100000000000000" "7a");
}

TEST(KCDataEncoderTest, DescriptionLayout) {
  cf::Array tasks;
  tasks.Append(Task("launchd", {Thread("main", cf::Value::SInt32(10))}));
  tasks.Append(Task("kernel_task", {Thread("idle"), Thread("VM_swapout", cf::Value::UInt64(UINT64_MAX))}));
  std::string error;
  const auto bytes = sim::EncodeKCDataStackshot(tasks, &error);
  ASSERT_TRUE(bytes) << error;
  KCDataBuilder expected;
  expected.Begin(1, sim::kKCDataStackshotKind)
      .Begin(2, sim::kKCDataTaskKind).TaskName("launchd")
      .Begin(3).ThreadName("main").IOStats(10).End(3)
      .End(2)
      .Begin(4, sim::kKCDataTaskKind).TaskName("kernel_task")
      .Begin(5).ThreadName("idle").End(5)
      .Begin(6).ThreadName("VM_swapout").IOStats(UINT64_MAX).End(6)
      .End(4)
      .End(1)
      .BufferEnd();
  EXPECT_EQ(Hex(*bytes), Hex(expected.bytes()));
  int found = 0;
  EXPECT_EQ(Writes(*bytes, &found), UINT64_MAX);
  EXPECT_EQ(found, 1);

  // A task without threads, and no tasks at all.
  cf::Dictionary lonely;
  lonely.Set("name", "VM_swapout");
  const auto alone = sim::EncodeKCDataStackshot(cf::Array({cf::Value(lonely)}), &error);
  ASSERT_TRUE(alone);
  EXPECT_EQ(Writes(*alone, &found), 0u);
  EXPECT_EQ(found, 0);
  const auto empty = sim::EncodeKCDataStackshot(cf::Array(), &error);
  ASSERT_TRUE(empty);
  EXPECT_EQ(Hex(*empty), Hex(KCDataBuilder().Begin(1, sim::kKCDataStackshotKind).End(1).BufferEnd().bytes()));
}

TEST(KCDataEncoderTest, WrongShapes) {
  cf::Dictionary unknown_task = Task("t", {});
  unknown_task.Set("thread", cf::Array());
  cf::Dictionary unknown_thread = Thread("x");
  unknown_thread.Set("diskwrites", cf::Value::SInt32(1));
  cf::Dictionary threads_dict;
  threads_dict.Set("name", "t");
  threads_dict.Set("threads", cf::Dictionary());
  cf::Dictionary nameless;
  nameless.Set("threads", cf::Array());
  struct Case {
    cf::Value description;
    const char* error;
  };
  const Case cases[] = {
      {cf::Dictionary(), "stackshot: the description must be an array of tasks, not a dictionary"},
      {cf::Value(), "stackshot: the description must be an array of tasks, not a null"},
      {cf::Array({cf::Value("t")}), "stackshot: task 0 must be a dictionary, not a string"},
      {cf::Array({cf::Value(nameless)}), "stackshot: task 0: \"name\" must be a string, not missing"},
      {cf::Array({cf::Value(Task(cf::Value::SInt32(3), {}))}),
       "stackshot: task 0: \"name\" must be a string, not a number"},
      {cf::Array({cf::Value(Task("", {}))}), "stackshot: task 0: \"name\" must have 1 to 63 characters and no NUL"},
      {cf::Array({cf::Value(Task(std::string(64, 'n'), {}))}),
       "stackshot: task 0: \"name\" must have 1 to 63 characters and no NUL"},
      {cf::Array({cf::Value(Task(std::string("a\0b", 3), {}))}),
       "stackshot: task 0: \"name\" must have 1 to 63 characters and no NUL"},
      {cf::Array({cf::Value(threads_dict)}), "stackshot: task 0: \"threads\" must be an array, not a dictionary"},
      {cf::Array({cf::Value(unknown_task)}), "stackshot: task 0: unknown key \"thread\""},
      {cf::Array({cf::Value(Task("t", {Thread("a")})), cf::Value(Task("u", {Thread("b"), cf::Value::Float64(1.5)}))}),
       "stackshot: task 1, thread 1 must be a dictionary, not a number"},
      {cf::Array({cf::Value(Task("t", {cf::Value(unknown_thread)}))}),
       "stackshot: task 0, thread 0: unknown key \"diskwrites\""},
      {cf::Array({cf::Value(Task("t", {cf::Dictionary()}))}),
       "stackshot: task 0, thread 0: \"name\" must be a string, not missing"},
      {cf::Array({cf::Value(Task("t", {Thread("x", "4096")}))}),
       "stackshot: task 0, thread 0: \"diskWrites\" must be a number, not a string"},
      {cf::Array({cf::Value(Task("t", {Thread("x", cf::Value::SInt64(-1))}))}),
       "stackshot: task 0, thread 0: \"diskWrites\" must be a whole number of bytes, not -1"},
      {cf::Array({cf::Value(Task("t", {Thread("x", cf::Value::Float64(4096))}))}),
       "stackshot: task 0, thread 0: \"diskWrites\" must be a whole number of bytes, not 4096"},
      {cf::Array({cf::Value(Task("t", {Thread("x", cf::Value::Bool(true))}))}),
       "stackshot: task 0, thread 0: \"diskWrites\" must be a number, not a boolean"},
  };
  for (const Case& c : cases) {
    std::string error;
    SCOPED_TRACE(c.description.Description());
    EXPECT_FALSE(sim::EncodeKCDataStackshot(c.description, &error));
    EXPECT_EQ(error, c.error);
  }
  EXPECT_FALSE(sim::EncodeKCDataStackshot(cf::Value(), nullptr));  // no error text wanted
}

}  // namespace
