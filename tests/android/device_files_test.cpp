// The device build files against the code: Android.bp builds what CMake's
// daemon target builds and nothing of the host's; the init script starts the
// binary Android.bp installs; the VINTF fragment declares exactly the
// instances the daemon registers; SELinux labels the binary and the devices
// the daemon opens with types its policy declares; the XML is well formed.
#include <gtest/gtest.h>

#include <regex.h>
#include <sys/wait.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <set>
#include <sstream>
#include <string>
#include <vector>

#include <host/rpc_hooks.h>

#include "async_cmd.h"
#include "fake_ese_hal.h"
#include "service.h"

namespace {

using ::android::sp;
using ::android::status_t;
using ::android::hidl::base::V1_0::IBase;

// POSIX extended regular expressions: every match of `pattern` in `text`,
// each as its groups (0 = the whole match).
std::vector<std::vector<std::string>> findAll(const std::string& pattern, const std::string& text) {
  std::vector<std::vector<std::string>> out;
  regex_t re;
  if (regcomp(&re, pattern.c_str(), REG_EXTENDED | REG_NEWLINE) != 0) {
    ADD_FAILURE() << "bad pattern " << pattern;
    return out;
  }
  regmatch_t m[8];
  size_t pos = 0;
  while (pos <= text.size() && regexec(&re, text.c_str() + pos, 8, m, pos ? REG_NOTBOL : 0) == 0) {
    std::vector<std::string> groups;
    for (const regmatch_t& g : m) {
      if (g.rm_so < 0) break;
      groups.push_back(text.substr(pos + g.rm_so, g.rm_eo - g.rm_so));
    }
    out.push_back(groups);
    pos += m[0].rm_eo > m[0].rm_so ? m[0].rm_eo : m[0].rm_so + 1;
  }
  regfree(&re);
  return out;
}

// The groups of the first match, empty when none.
std::vector<std::string> findFirst(const std::string& pattern, const std::string& text) {
  auto all = findAll(pattern, text);
  return all.empty() ? std::vector<std::string>() : all[0];
}

bool wholeMatch(const std::string& pattern, const std::string& text) {
  return !findFirst("^(" + pattern + ")$", text).empty();
}

std::string readFile(const std::string& rel) {
  std::ifstream in(std::string(SE_SOURCE_DIR) + "/" + rel);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

std::vector<std::string> lines(const std::string& text) {
  std::vector<std::string> out;
  std::istringstream in(text);
  for (std::string l; std::getline(in, l);) out.push_back(l);
  return out;
}

// The quoted strings of the list `key: [ ... ]` inside the module `name`.
std::vector<std::string> bpList(const std::string& bp, const std::string& module,
                                const std::string& key) {
  std::vector<std::string> out;
  const size_t at = bp.find("name: \"" + module + "\"");
  if (at == std::string::npos) return out;
  const size_t end = bp.find("\n}", at);
  const std::string block = bp.substr(at, end - at);
  const size_t k = block.find(key + ": [");
  if (k == std::string::npos) return out;
  const std::string list = block.substr(k, block.find(']', k) - k);
  for (const auto& g : findAll("\"([^\"]*)\"", list)) out.push_back(g[1]);
  return out;
}

std::string bpValue(const std::string& bp, const std::string& module, const std::string& key) {
  const size_t at = bp.find("name: \"" + module + "\"");
  const std::string block = bp.substr(at, bp.find("\n}", at) - at);
  const auto g = findFirst(key + ": ([^,\n]*),", block);
  return g.empty() ? "" : g[1];
}

std::vector<std::string> sorted(std::vector<std::string> v) {
  std::sort(v.begin(), v.end());
  return v;
}

const std::string kBp = readFile("Android.bp");
const std::string kBinary = SE_DAEMON_NAME;

TEST(DeviceFiles, AndroidBpBuildsExactlyTheDaemonSourcesOfTheCMakeTarget) {
  std::ifstream in(SE_DAEMON_SOURCES);
  std::vector<std::string> cmake;
  for (std::string l; std::getline(in, l);)
    if (!l.empty()) cmake.push_back(l);
  ASSERT_GE(cmake.size(), 10u);
  const std::vector<std::string> bp = bpList(kBp, kBinary, "srcs");
  EXPECT_EQ(sorted(bp), sorted(cmake));
  // Host stand-ins, simulators and tools stay out of a device build.
  for (const std::string& s : bp) {
    for (const char* host : {"platform/", "ese-sim/", "modem-sim/", "secli/", "card/", "tests/"}) {
      EXPECT_NE(s.rfind(host, 0), 0u) << s;
    }
  }
  EXPECT_EQ(bpValue(kBp, kBinary, "vendor"), "true");
  EXPECT_EQ(bpValue(kBp, kBinary, "relative_install_path"), "\"hw\"");
  const std::vector<std::string> libs = bpList(kBp, kBinary, "shared_libs");
  for (const char* lib : {"android.hardware.secure_element@1.0",
                          "android.hardware.secure_element-V1-ndk", "libese_qv_hal"}) {
    EXPECT_NE(std::find(libs.begin(), libs.end(), lib), libs.end()) << lib;
  }
  // Every file the module names exists.
  for (const char* key : {"init_rc", "vintf_fragments"}) {
    const std::vector<std::string> files = bpList(kBp, kBinary, key);
    ASSERT_EQ(files.size(), 1u) << key;
    EXPECT_FALSE(readFile(files[0]).empty()) << files[0];
  }
}

TEST(DeviceFiles, TheInitScriptStartsTheInstalledBinaryWithTheModemPortsGroup) {
  const std::string rc = readFile(bpList(kBp, kBinary, "init_rc").at(0));
  const auto service = findFirst("^service ([^ ]+) ([^ ]+)$", rc);
  ASSERT_EQ(service.size(), 3u) << rc;
  EXPECT_EQ(service[2], "/vendor/bin/hw/" + kBinary);
  EXPECT_FALSE(findFirst("^    class hal$", rc).empty());
  EXPECT_FALSE(findFirst("^    user [a-z_]+$", rc).empty());
  // The modem's AT ports belong to radio.
  EXPECT_FALSE(findFirst("^    group ([a-z_]+ )*radio( [a-z_]+)*$", rc).empty()) << rc;
}

// Names the daemon registers, with an eSE (so both instances of both kinds).
std::vector<std::string> registeredNames() {
  std::vector<std::string> names;
  ::android::host::RpcHooks hooks;
  hooks.registerService = [&](const std::string& descriptor, const std::string& name,
                              const sp<IBase>&) -> status_t {
    names.push_back(name.find('/') == std::string::npos ? "hidl " + descriptor + "/" + name
                                                        : "aidl " + name);
    return ::android::OK;
  };
  hooks.configureThreadpool = [](size_t, bool) {};
  hooks.joinThreadpool = [] {};
  ::android::host::setRpcHooks(&hooks);
  fake_ese::reset();
  fake_ese::setEseType(1);
  qvese_service_main();
  ::android::host::setRpcHooks(nullptr);
  return names;
}

TEST(DeviceFiles, TheManifestDeclaresTheInstancesTheDaemonRegisters) {
  const std::string xml = readFile(bpList(kBp, kBinary, "vintf_fragments").at(0));
  std::vector<std::string> declared;
  size_t at = 0;
  while ((at = xml.find("<hal format=\"", at)) != std::string::npos) {
    const size_t end = xml.find("</hal>", at);
    ASSERT_NE(end, std::string::npos);
    const std::string body = xml.substr(at, end - at);
    at = end;
    const auto format = findFirst("<hal format=\"([a-z]+)\">", body);
    const auto name = findFirst("<name>([^<]+)</name>", body);
    const auto version = findFirst("<version>([^<]+)</version>", body);
    ASSERT_FALSE(format.empty() || name.empty() || version.empty()) << body;
    if (format[1] == "hidl") {
      const auto iface = findFirst("<interface>[[:space:]]*<name>([^<]+)</name>", body);
      ASSERT_FALSE(iface.empty()) << body;
      for (const auto& i : findAll("<instance>([^<]+)</instance>", body)) {
        declared.push_back("hidl " + name[1] + "@" + version[1] + "::" + iface[1] + "/" + i[1]);
      }
    } else {
      EXPECT_EQ(format[1], "aidl");
      EXPECT_EQ(version[1], "1");
      for (const auto& f : findAll("<fqname>([^<]+)</fqname>", body)) {
        declared.push_back("aidl " + name[1] + "." + f[1]);
      }
    }
  }
  EXPECT_EQ(sorted(declared), sorted(registeredNames()));
}

TEST(DeviceFiles, TheXmlIsWellFormed) {
  const std::string path =
      std::string(SE_SOURCE_DIR) + "/" + bpList(kBp, kBinary, "vintf_fragments").at(0);
  const std::string cmd = "xmllint --noout '" + path + "' 2>&1";
  FILE* p = popen(cmd.c_str(), "r");
  ASSERT_NE(p, nullptr);
  std::string out;
  char buf[256];
  while (fgets(buf, sizeof(buf), p)) out += buf;
  const int status = pclose(p);
  ASSERT_TRUE(WIFEXITED(status));
  ASSERT_NE(WEXITSTATUS(status), 127) << "xmllint is missing (scripts/deps.sh installs it)";
  EXPECT_EQ(WEXITSTATUS(status), 0) << out;
}

TEST(DeviceFiles, SelinuxLabelsTheBinaryAndTheDaemonsDevicesWithDeclaredTypes) {
  const std::string contexts = readFile("android/sepolicy/file_contexts");
  const std::string te = readFile("android/sepolicy/hal_secure_element_qvese.te");
  struct Entry {
    std::string path;  // a regular expression over the whole path
    std::string type;
  };
  std::vector<Entry> entries;
  for (const std::string& l : lines(contexts)) {
    if (l.empty() || l[0] == '#') continue;
    const auto m = findFirst("^([^ ]+) +u:object_r:([a-z0-9_]+):s0$", l);
    ASSERT_EQ(m.size(), 3u) << l;
    entries.push_back({m[1], m[2]});
    EXPECT_NE(te.find("type " + m[2] + ","), std::string::npos) << m[2];
  }
  auto labelOf = [&](const std::string& path) {
    for (const Entry& e : entries)
      if (wholeMatch(e.path, path)) return e.type;
    return std::string();
  };
  EXPECT_EQ(labelOf("/vendor/bin/hw/" + kBinary), "hal_secure_element_qvese_exec");
  for (const char* dev : {MODEM0_AT_DEV_PATH, MODEM1_AT_DEV_PATH}) {
    EXPECT_FALSE(labelOf(dev).empty()) << dev;
  }
  EXPECT_FALSE(labelOf("/sys/nfc/nfc_sim_switch").empty());
  EXPECT_NE(te.find("init_daemon_domain(hal_secure_element_qvese)"), std::string::npos);
}

}  // namespace
