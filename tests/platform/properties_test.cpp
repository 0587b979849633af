// Properties file rules and the device-root path mapping.
#include <gtest/gtest.h>

#include <cutils/properties.h>
#include <host/device_root.h>

#include <fcntl.h>
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

}  // namespace
