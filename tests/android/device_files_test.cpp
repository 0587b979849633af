// The device build files against the code: Android.bp builds what CMake's
// daemon target builds and nothing of the host's; the init script starts the
// binary Android.bp installs; the VINTF fragment declares exactly the
// instances the daemon registers; SELinux labels the binary and the devices
// the daemon opens with types its policy declares; the XML is well formed.
#include <gtest/gtest.h>

#include <sys/wait.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <regex>
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
  std::regex quoted("\"([^\"]*)\"");
  for (std::sregex_iterator it(list.begin(), list.end(), quoted), e; it != e; ++it) {
    out.push_back((*it)[1]);
  }
  return out;
}

std::string bpValue(const std::string& bp, const std::string& module, const std::string& key) {
  const size_t at = bp.find("name: \"" + module + "\"");
  const std::string block = bp.substr(at, bp.find("\n}", at) - at);
  std::smatch m;
  if (std::regex_search(block, m, std::regex(key + ": ([^,\n]*),"))) return m[1];
  return "";
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
  std::smatch m;
  ASSERT_TRUE(std::regex_search(rc, m, std::regex("\nservice (\\S+) (\\S+)\n"))) << rc;
  EXPECT_EQ(m[2].str(), "/vendor/bin/hw/" + kBinary);
  EXPECT_TRUE(std::regex_search(rc, std::regex("\n    class hal\n")));
  EXPECT_TRUE(std::regex_search(rc, std::regex("\n    user \\S+\n")));
  // The modem's AT ports belong to radio.
  EXPECT_TRUE(std::regex_search(rc, std::regex("\n    group [^\n]*\\bradio\\b")));
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
  std::regex hal("<hal format=\"(\\w+)\">([\\s\\S]*?)</hal>");
  for (std::sregex_iterator it(xml.begin(), xml.end(), hal), e; it != e; ++it) {
    const std::string format = (*it)[1];
    const std::string body = (*it)[2];
    std::smatch name, version;
    ASSERT_TRUE(std::regex_search(body, name, std::regex("<name>([^<]+)</name>")));
    ASSERT_TRUE(std::regex_search(body, version, std::regex("<version>([^<]+)</version>")));
    if (format == "hidl") {
      std::smatch iface;
      ASSERT_TRUE(std::regex_search(body, iface,
                                    std::regex("<interface>\\s*<name>([^<]+)</name>")));
      std::regex inst("<instance>([^<]+)</instance>");
      for (std::sregex_iterator i(body.begin(), body.end(), inst), ie; i != ie; ++i) {
        declared.push_back("hidl " + name[1].str() + "@" + version[1].str() + "::" +
                           iface[1].str() + "/" + (*i)[1].str());
      }
    } else {
      EXPECT_EQ(format, "aidl");
      EXPECT_EQ(version[1].str(), "1");
      std::regex fq("<fqname>([^<]+)</fqname>");
      for (std::sregex_iterator i(body.begin(), body.end(), fq), ie; i != ie; ++i) {
        declared.push_back("aidl " + name[1].str() + "." + (*i)[1].str());
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
    std::regex path;
    std::string type;
  };
  std::vector<Entry> entries;
  std::regex line("^(\\S+)\\s+u:object_r:(\\w+):s0$");
  for (const std::string& l : lines(contexts)) {
    std::smatch m;
    if (l.empty() || l[0] == '#') continue;
    ASSERT_TRUE(std::regex_match(l, m, line)) << l;
    entries.push_back({std::regex(m[1].str()), m[2]});
    EXPECT_NE(te.find("type " + m[2].str() + ","), std::string::npos) << m[2];
  }
  auto labelOf = [&](const std::string& path) {
    for (const Entry& e : entries)
      if (std::regex_match(path, e.path)) return e.type;
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
