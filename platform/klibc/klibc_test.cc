#include <cstring>
#include <memory>
#include <signal.h>
#include <sstream>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>
#include <vector>

#include <gtest/gtest.h>

#include "klibc/atomic_file.h"
#include "klibc/hex.h"
#include "klibc/json_text.h"
#include "klibc/key_value_file.h"
#include "klibc/last_error.h"
#include "klibc/process.h"
#include "klibc/string_list.h"
#include "klibc/sysroot.h"
#include "testing/temp_root.h"

namespace {

class KeyValueFileTest : public ::testing::Test {
 protected:
  std::string Conf() const { return root_.Path("/etc/kivoinfo.conf"); }
  std::string Get(const std::string& key) const {
    char buf[128];
    int n = KLIBCFileGetKeyValue(Conf().c_str(), key.c_str(), buf, sizeof(buf), 0);
    return n > 0 ? buf : "<none>";
  }
  TempRoot root_;
};

TEST_F(KeyValueFileTest, SetKeepsOtherLinesAndComments) {
  root_.Write("/etc/kivoinfo.conf", "# keep me\nfoo=\"1\"\n\nbar=plain\n");
  ASSERT_EQ(0, KLIBCINFOSetKeyValue("foo", "two words"));
  ASSERT_EQ(0, KLIBCINFOSetKeyValue("new_key", "x"));
  EXPECT_EQ("two words", Get("foo"));
  EXPECT_EQ("plain", Get("bar"));
  EXPECT_EQ("x", Get("new_key"));
  std::string text;
  ASSERT_TRUE(KIVOReadFile(Conf(), &text));
  EXPECT_EQ("# keep me\nfoo=\"two words\"\n\nbar=plain\nnew_key=\"x\"\n", text);
}

TEST_F(KeyValueFileTest, QuotesAndBackslashesRoundTrip) {
  ASSERT_EQ(0, KLIBCINFOSetKeyValue("tricky", "a \"quoted\" \\ value"));
  EXPECT_EQ("a \"quoted\" \\ value", Get("tricky"));
  EXPECT_EQ(1, KLIBCFileCheckKeyValue(Conf().c_str(), "tricky", "a \"quoted\" \\ value", 0));
  EXPECT_EQ(0, KLIBCFileCheckKeyValue(Conf().c_str(), "tricky", "other", 0));
}

TEST_F(KeyValueFileTest, RefusesBadKeysAndNewlines) {
  EXPECT_EQ(-1, KLIBCINFOSetKeyValue("bad key", "x"));
  EXPECT_EQ(KLIBC_ERR_BAD_PARAMETER, KLIBCErrGet());
  EXPECT_EQ(-1, KLIBCINFOSetKeyValue("k", "line\nbreak"));
  EXPECT_EQ("<none>", Get("k"));
}

TEST_F(KeyValueFileTest, MissingFileAndKey) {
  char buf[16];
  EXPECT_EQ(-1, KLIBCFileGetKeyValue(root_.Path("/nope").c_str(), "a", buf, sizeof(buf), 0));
  EXPECT_EQ(-1, KLIBCFileCheckKeyValue(root_.Path("/nope").c_str(), "a", "b", 0));
  EXPECT_EQ(0, KLIBCFileGetKeyValue(Conf().c_str(), "absent", buf, sizeof(buf), 0));
}

TEST_F(KeyValueFileTest, LongValueIsCutToTheBuffer) {
  ASSERT_EQ(0, KLIBCINFOSetKeyValue("long", std::string(300, 'v').c_str()));
  char buf[128];
  EXPECT_EQ(127, KLIBCFileGetKeyValue(Conf().c_str(), "long", buf, sizeof(buf), 0));
  EXPECT_EQ(127u, strlen(buf));
}

// Writers in several processes at once must not lose each other's keys.
TEST_F(KeyValueFileTest, ConcurrentWritersLoseNothing) {
  std::vector<pid_t> children;
  for (int c = 0; c < 4; ++c) {
    pid_t pid = fork();
    if (pid == 0) {
      for (int i = 0; i < 25; ++i) {
        std::string key = "k" + std::to_string(c) + "_" + std::to_string(i);
        if (KLIBCINFOSetKeyValue(key.c_str(), "v") != 0) _exit(1);
      }
      _exit(0);
    }
    children.push_back(pid);
  }
  for (pid_t pid : children) {
    int status;
    waitpid(pid, &status, 0);
    EXPECT_EQ(0, WEXITSTATUS(status));
  }
  KeyValueMap all;
  ASSERT_TRUE(KIVOKeyValueLoad(Conf(), &all));
  for (int c = 0; c < 4; ++c) {
    for (int i = 0; i < 25; ++i)
      EXPECT_EQ(1u, all.count("k" + std::to_string(c) + "_" + std::to_string(i)));
  }
}

TEST(SysRootTest, ResolvesUnderTheRoot) {
  setenv("KIVO_ROOT", "/some/root/", 1);
  EXPECT_EQ("/some/root/etc/kivoinfo.conf", KIVORootPath("/etc/kivoinfo.conf"));
  setenv("KIVO_ROOT", "/", 1);
  EXPECT_EQ("/etc/kivoinfo.conf", KIVORootPath("/etc/kivoinfo.conf"));
  unsetenv("KIVO_ROOT");
  EXPECT_EQ("/volume1", KIVORootPath("/volume1"));
}

TEST(AtomicFileTest, ReplacesWholeAndLeavesNoTemporaryFiles) {
  TempRoot root;
  std::string path = root.Path("/tmp/f");
  ASSERT_TRUE(KIVOWriteFileAtomic(path, "first"));
  ASSERT_TRUE(KIVOWriteFileAtomic(path, "second"));
  std::string text;
  ASSERT_TRUE(KIVOReadFile(path, &text));
  EXPECT_EQ("second", text);
  EXPECT_FALSE(KIVOWriteFileAtomic(root.Path("/no/such/dir/f"), "x"));
  EXPECT_EQ(KLIBC_ERR_FILE_WRITE, KLIBCErrGet());
  EXPECT_FALSE(KIVOReadFile(root.Path("/missing"), &text));
  EXPECT_EQ(KLIBC_ERR_NOT_FOUND, KLIBCErrGet());
  EXPECT_STRNE("", KLIBCErrorGetFile());
  EXPECT_GT(KLIBCErrorGetLine(), 0);
}

TEST(ProcessTest, ExecReturnsTheExitStatusAndPassesArgumentsAsWords) {
  EXPECT_EQ(0, KLIBCExec("/bin/true", nullptr, nullptr, nullptr, nullptr));
  // "$0" is "x"; the rest arrives as one word, shell characters and all.
  EXPECT_EQ(1, KLIBCExec("/bin/sh", "-c", "exit $#", "x", "a b; echo injected"));
  EXPECT_EQ(127, KLIBCExec("/no/such/program", nullptr, nullptr, nullptr, nullptr));
}

TEST(ProcessTest, PopenReadsStdoutAndPcloseGivesStatus) {
  FILE* f = KLIBCPopen("/bin/sh", "r", "-c", "echo hello; exit 4", nullptr, nullptr);
  ASSERT_NE(nullptr, f);
  char line[64] = {0};
  ASSERT_NE(nullptr, fgets(line, sizeof(line), f));
  EXPECT_STREQ("hello\n", line);
  EXPECT_EQ(4, KLIBCPclose(f));
  EXPECT_EQ(nullptr, KLIBCPopen("/bin/true", "rw", nullptr, nullptr, nullptr, nullptr));
}

TEST(ProcessTest, AliveSeesLivingDeadAndZombieProcesses) {
  EXPECT_EQ(1, KLIBCProcAlive(getpid()));
  pid_t child = KLIBCProcFork();
  if (child == 0) _exit(0);
  // Until it is reaped the child is a zombie: it has ended all the same.
  for (int i = 0; i < 100 && KLIBCProcAlive(child); ++i) usleep(10000);
  EXPECT_EQ(0, KLIBCProcAlive(child));
  waitpid(child, nullptr, 0);
  EXPECT_EQ(0, KLIBCProcAlive(child));
  EXPECT_EQ(0, KLIBCProcAlive(0));
}

TEST(StringListTest, ListAndHash) {
  PKLIBSZLIST list = KLIBCSzListAlloc(512);
  ASSERT_EQ(0, KLIBCSzListPush(&list, "a"));
  ASSERT_EQ(0, KLIBCSzListPush(&list, "b"));
  EXPECT_EQ(2, list->nItem());
  EXPECT_STREQ("b", KLIBCSzListGet(list, 1));
  EXPECT_EQ(nullptr, KLIBCSzListGet(list, 2));
  KLIBCSzListFree(list);

  PKLIBSZHASH hash = KLIBCSzHashAlloc(1024);
  ASSERT_EQ(0, KLIBCSzHashSetValue(&hash, "action", "one"));
  ASSERT_EQ(0, KLIBCSzHashSetValue(&hash, "action", "two"));
  EXPECT_STREQ("two", KLIBCSzHashGetValue(hash, "action"));
  EXPECT_EQ(1u, hash->entries.size());
  EXPECT_EQ(-1, KLIBCSzHashSetValue(&hash, nullptr, "x"));
  KLIBCSzHashFree(hash);
}

TEST(JsonTextTest, DeepOrMalformedTextIsRefusedWithoutThrowing) {
  Json::Value v(42);
  const std::string deep = std::string(100000, '[') + std::string(100000, ']');
  EXPECT_FALSE(KIVOParseJson(deep, &v));
  EXPECT_TRUE(v.isNull());
  EXPECT_FALSE(KIVOParseJson(deep, &v, JsonSyntax::Lenient));
  const std::string at_limit =
      std::string(kMaxJsonDepth - 1, '[') + std::string(kMaxJsonDepth - 1, ']');
  EXPECT_TRUE(KIVOParseJson(at_limit, &v));
  for (const char* bad : {"", "{", "[1,]", "{\"a\":1} x", "nul"}) {
    EXPECT_FALSE(KIVOParseJson(bad, &v)) << bad;
  }
  // Comments are what only the lenient syntax allows; any value may be the
  // root of either.
  EXPECT_FALSE(KIVOParseJson("// note\n{\"a\": 1}", &v));
  EXPECT_TRUE(KIVOParseJson("// note\n{\"a\": 1}", &v, JsonSyntax::Lenient));
  EXPECT_EQ(1, v["a"].asInt());
  EXPECT_TRUE(KIVOParseJson("\"text\"", &v));
  EXPECT_EQ("text", v.asString());
}

TEST(JsonTextTest, WrittenTextIsCompactEscapedAndReadsBack) {
  Json::Value v(Json::objectValue);
  v["b"] = true;
  v["a"] = Json::Value(Json::arrayValue);
  v["a"].append(1);
  v["a"].append("x y");
  v["a"].append(Json::Value());
  v["c"] = "\xc3\xa9";  // é, in UTF-8
  const std::string text = KIVOWriteJson(v);
  EXPECT_EQ("{\"a\":[1,\"x y\",null],\"b\":true,\"c\":\"\\u00e9\"}", text);
  Json::Value back;
  ASSERT_TRUE(KIVOParseJson(text, &back));
  EXPECT_EQ(v, back);
  // The indented form people read; the same writer object serves many
  // values alike.
  Json::Value one(Json::objectValue);
  one["b"] = 2;
  EXPECT_EQ("{\n  \"b\" : 2\n}", KIVOWriteJson(one, "  "));
  std::ostringstream out;
  const std::unique_ptr<Json::StreamWriter> writer = KIVONewJsonWriter();
  writer->write(one, &out);
  writer->write(one, &out);
  EXPECT_EQ("{\"b\":2}{\"b\":2}", out.str());
}

TEST(HexTest, BytesBecomeLowerCaseDigitPairs) {
  const unsigned char bytes[] = {0x00, 0x01, 0x7f, 0x80, 0xab, 0xff};
  EXPECT_EQ("00017f80abff", KIVOHex(bytes, sizeof(bytes)));
  EXPECT_EQ("", KIVOHex(bytes, 0));
  EXPECT_TRUE(KIVOIsLowerHex("00017f80abff"));
  for (const char* bad : {"", "00FF", "0g", "ab cd", "-1"})
    EXPECT_FALSE(KIVOIsLowerHex(bad)) << bad;
}

TEST(HexTest, RandomHexHasTheLengthAndDigitsAndDiffersEachDraw) {
  std::string first, second;
  ASSERT_TRUE(KIVORandomHex(16, &first));
  ASSERT_TRUE(KIVORandomHex(16, &second));
  EXPECT_EQ(32u, first.size());
  EXPECT_TRUE(KIVOIsLowerHex(first)) << first;
  EXPECT_TRUE(KIVOIsLowerHex(second)) << second;
  EXPECT_NE(first, second);
  ASSERT_TRUE(KIVORandomHex(0, &first));
  EXPECT_EQ("", first);
}

}  // namespace
