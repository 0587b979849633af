// Properties file rules, the device-root path mapping, and Unix socket
// paths as long as a deep device root makes them.
#include <gtest/gtest.h>

#include <cutils/properties.h>
#include <host/device_root.h>
#include <host/unix_socket.h>

#include <fcntl.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstring>
#include <fstream>

#include "test_root.h"

namespace {

std::string get(const char* key, const char* def = "dflt") {
  char value[PROPERTY_VALUE_MAX];
  memset(value, 'X', sizeof(value));
  int n = property_get(key, value, def);
  EXPECT_EQ(n, static_cast<int>(strlen(value)));
  return value;
}

class PropertiesTest : public ::testing::Test {
 protected:
  se_test::TestRoot root;
};

TEST_F(PropertiesTest, NoFileMeansDefault) {
  EXPECT_EQ(get("ro.odm.config.modem_number"), "dflt");
  EXPECT_EQ(get("ro.odm.config.modem_number", nullptr), "");
}

TEST_F(PropertiesTest, FileRules) {
  std::string longValue(120, 'v');
  root.writeFile("properties",
                 "# ro.a=commented\n"
                 "\n"
                 "   \n"
                 "ro.a=1\n"
                 "ro.ab=prefix-of-another-name\n"
                 "  # indented comment ro.b=2\n"
                 "ro.a=2\r\n"
                 "ro.long=" + longValue + "\n"
                 "no equals sign\n"
                 "ro.empty=\n"
                 "ro.eq=a=b\n"
                 "ro.last=no newline at end");
  struct Case {
    const char* key;
    std::string want;
  };
  const Case cases[] = {
      {"ro.a", "2"},                          // the last line wins, CR dropped
      {"ro.ab", "prefix-of-another-name"},
      {"ro.b", "dflt"},                       // only inside a comment
      {"ro.long", std::string(91, 'v')},      // cut to PROPERTY_VALUE_MAX - 1
      {"ro.empty", "dflt"},                   // an empty value is no value
      {"ro.eq", "a=b"},                       // split at the first '='
      {"ro.last", "no newline at end"},
      {"no equals sign", "dflt"},
      {"", "dflt"},
  };
  for (const Case& c : cases) EXPECT_EQ(get(c.key), c.want) << c.key;
  // Read afresh: an appended line takes effect at once.
  root.appendFile("properties", "\nro.a=3\n");
  EXPECT_EQ(get("ro.a"), "3");
  // A default longer than a value is cut the same way.
  EXPECT_EQ(get("ro.none", longValue.c_str()), std::string(91, 'v'));
}

TEST(DeviceRoot, MapsAbsolutePathsUnderTheRoot) {
  struct Case {
    const char* root;  // nullptr: unset
    const char* path;
    const char* want;
  };
  const Case cases[] = {
      {nullptr, "/dev/appvcom18", "/dev/appvcom18"},
      {"/", "/dev/appvcom18", "/dev/appvcom18"},
      {"/tmp/r", "/dev/appvcom18", "/tmp/r/dev/appvcom18"},
      {"/tmp/r//", "/sys/nfc/nfc_sim_switch", "/tmp/r/sys/nfc/nfc_sim_switch"},
      {"/tmp/r", "relative/file", "relative/file"},
      {"/tmp/r", "", ""},
  };
  for (const Case& c : cases) {
    if (c.root) {
      setenv("SE_DEVICE_ROOT", c.root, 1);
    } else {
      unsetenv("SE_DEVICE_ROOT");
    }
    EXPECT_EQ(android::host::mapDevicePath(c.path), c.want) << (c.root ? c.root : "(unset)");
  }
}

TEST(DeviceRoot, OpenResolvesUnderTheRoot) {
  se_test::TestRoot root;  // dev/ made
  root.writeFile("dev/appvcom18", "AT");
  int fd = open("/dev/appvcom18", O_RDONLY);
  ASSERT_GE(fd, 0);
  char buf[4] = {};
  EXPECT_EQ(read(fd, buf, sizeof(buf)), 2);
  EXPECT_STREQ(buf, "AT");
  close(fd);
  EXPECT_LT(open("/dev/no-such-node", O_RDONLY), 0);
}

// A socket whose path is longer than an address holds is bound and reached
// through its folder, in a program whose open() maps absolute paths under a
// device root; a name too long even for that is refused with a sentence that
// names the path.
TEST(UnixSocketAt, PathsOfAnyLengthAndNamesThatCannotBe) {
  se_test::TestRoot root;
  std::string dir = root.path();
  while (dir.size() < 250) dir += "/" + std::string(40, 's');
  std::filesystem::create_directories(dir);
  const struct {
    std::string path;
    bool works;
    const char* why;
  } cases[] = {
      {root.at("short"), true, ""},
      {dir + "/SIM1", true, ""},
      {dir + "/" + std::string(100, 'n'), false, "is too long for a Unix socket address"},
      {dir + "/missing/SIM1", false, "cannot open its folder"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.path.substr(c.path.rfind('/')));
    std::string error;
    const int server = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    const int client = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    const bool bound = android::host::bindUnixAt(server, c.path, &error) && listen(server, 1) == 0;
    EXPECT_EQ(bound, c.works) << error;
    if (!c.works) {
      EXPECT_NE(error.find(c.path), std::string::npos) << error;
      EXPECT_NE(error.find(c.why), std::string::npos) << error;
    }
    EXPECT_EQ(android::host::connectUnixAt(client, c.path, &error), c.works) << error;
    if (c.works) {
      const int accepted = accept(server, nullptr, nullptr);
      EXPECT_GE(accepted, 0);
      EXPECT_EQ(write(client, "x", 1), 1);
      char b = 0;
      EXPECT_EQ(read(accepted, &b, 1), 1);
      EXPECT_EQ(b, 'x');
      close(accepted);
    }
    close(client);
    close(server);
  }
}

}  // namespace
