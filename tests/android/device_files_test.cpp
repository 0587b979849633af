// The device build files against the code: Android.bp builds what CMake's
// daemon target builds and nothing of the host's; the init script starts the
// binary Android.bp installs; the VINTF fragment declares exactly the
// instances the daemon registers; SELinux labels the binary and the devices
// the daemon opens with types its policy declares; the XML is well formed
// and Android.bp is as bpfmt parses and formats it.
#include <gtest/gtest.h>

#include <sys/wait.h>

#include <algorithm>
#include <cstdio>
#include <fstream>
#include <regex>
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
using Strings = std::vector<std::string>;

// Every match of `pattern` in `text`, each as its groups (0 = the whole match).
std::vector<Strings> findAll(const std::string& pattern, const std::string& text) {
  std::vector<Strings> out;
  const std::regex re(pattern);
  for (std::sregex_iterator it(text.begin(), text.end(), re), end; it != end; ++it) {
    out.emplace_back(it->begin(), it->end());
  }
  return out;
}

// The groups of the first match, empty when none.
Strings findFirst(const std::string& pattern, const std::string& text) {
  auto all = findAll(pattern, text);
  return all.empty() ? Strings() : all[0];
}

std::string readFile(const std::string& rel) {
  std::ifstream in(std::string(SE_SOURCE_DIR) + "/" + rel);
  std::stringstream ss;
  ss << in.rdbuf();
  return ss.str();
}

Strings lines(const std::string& text) {
  Strings out;
  std::istringstream in(text);
  for (std::string l; std::getline(in, l);) out.push_back(l);
  return out;
}

bool hasLine(const std::string& text, const std::string& pattern) {
  const Strings all = lines(text);
  return std::any_of(all.begin(), all.end(),
                     [&](const std::string& l) { return std::regex_match(l, std::regex(pattern)); });
}

Strings sorted(Strings v) {
  std::sort(v.begin(), v.end());
  return v;
}

const std::string kBp = readFile("Android.bp");
const std::string kBinary = SE_DAEMON_NAME;

std::string daemonModule() {
  const size_t at = kBp.find("name: \"" + kBinary + "\"");
  return at == std::string::npos ? "" : kBp.substr(at, kBp.find("\n}", at) - at);
}

// The quoted strings of the list `key: [ ... ]` in the daemon's module.
Strings bpList(const std::string& key) {
  Strings out;
  const Strings list = findFirst(key + ": \\[([^\\]]*)\\]", daemonModule());
  if (list.empty()) return out;
  for (const auto& g : findAll("\"([^\"]*)\"", list[1])) out.push_back(g[1]);
  return out;
}

TEST(DeviceFiles, AndroidBpBuildsExactlyTheDaemonSourcesOfTheCMakeTarget) {
  std::ifstream in(SE_DAEMON_SOURCES);
  Strings cmake;
  for (std::string l; std::getline(in, l);)
    if (!l.empty()) cmake.push_back(l);
  ASSERT_GE(cmake.size(), 10u);
  const Strings bp = bpList("srcs");
  EXPECT_EQ(sorted(bp), sorted(cmake));
  // Host stand-ins, simulators and tools stay out of a device build.
  for (const std::string& s : bp) {
    for (const char* host : {"platform/", "ese-sim/", "modem-sim/", "secli/", "card/", "tests/"}) {
      EXPECT_NE(s.rfind(host, 0), 0u) << s;
    }
  }
  EXPECT_FALSE(findFirst("\n *vendor: true,", daemonModule()).empty());
  EXPECT_FALSE(findFirst("\n *relative_install_path: \"hw\",", daemonModule()).empty());
  const Strings libs = bpList("shared_libs");
  for (const char* lib : {"android.hardware.secure_element@1.0",
                          "android.hardware.secure_element-V1-ndk", "libese_qv_hal"}) {
    EXPECT_NE(std::find(libs.begin(), libs.end(), lib), libs.end()) << lib;
  }
  for (const char* key : {"init_rc", "vintf_fragments"}) {
    const Strings files = bpList(key);
    ASSERT_EQ(files.size(), 1u) << key;
    EXPECT_FALSE(readFile(files[0]).empty()) << files[0];
  }
}

TEST(DeviceFiles, TheInitScriptStartsTheInstalledBinaryWithTheModemPortsGroup) {
  const std::string rc = readFile(bpList("init_rc").at(0));
  const std::string binary = std::regex_replace(kBinary, std::regex("\\."), "\\.");
  EXPECT_TRUE(hasLine(rc, "service [^ ]+ /vendor/bin/hw/" + binary)) << rc;
  EXPECT_TRUE(hasLine(rc, "    class hal"));
  EXPECT_TRUE(hasLine(rc, "    user [a-z_]+"));
  // The modem's AT ports belong to radio.
  EXPECT_TRUE(hasLine(rc, "    group ([a-z_]+ )*radio( [a-z_]+)*")) << rc;
}

// Names the daemon registers, with an eSE (so both instances of both kinds).
Strings registeredNames() {
  Strings names;
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
  const std::string xml = readFile(bpList("vintf_fragments").at(0));
  Strings declared;
  for (const Strings& hal : findAll("<hal format=\"([a-z]+)\">([\\s\\S]*?)</hal>", xml)) {
    const std::string& body = hal[2];
    const auto name = findFirst("<name>([^<]+)</name>", body);
    const auto version = findFirst("<version>([^<]+)</version>", body);
    ASSERT_FALSE(name.empty() || version.empty()) << body;
    if (hal[1] == "hidl") {
      const auto iface = findFirst("<interface>\\s*<name>([^<]+)</name>", body);
      ASSERT_FALSE(iface.empty()) << body;
      for (const auto& i : findAll("<instance>([^<]+)</instance>", body)) {
        declared.push_back("hidl " + name[1] + "@" + version[1] + "::" + iface[1] + "/" + i[1]);
      }
    } else {
      EXPECT_EQ(hal[1], "aidl");
      EXPECT_EQ(version[1], "1");
      for (const auto& f : findAll("<fqname>([^<]+)</fqname>", body)) {
        declared.push_back("aidl " + name[1] + "." + f[1]);
      }
    }
  }
  EXPECT_EQ(sorted(declared), sorted(registeredNames()));
}

// Runs `tool args` on a source file; its exit status (127: not installed)
// and everything it printed.
int runTool(const std::string& tool, const std::string& args, const std::string& rel, std::string* out) {
  const std::string cmd = tool + " " + args + " '" + std::string(SE_SOURCE_DIR) + "/" + rel + "' 2>&1";
  FILE* p = popen(cmd.c_str(), "r");
  if (p == nullptr) return -1;
  char buf[256];
  while (fgets(buf, sizeof(buf), p)) *out += buf;
  const int status = pclose(p);
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

// Checked by the field's own tools: the manifest by xmllint, Android.bp by
// bpfmt (Debian's blueprint-tools), which parses it as Soong does and shows
// any difference from its formatting.
TEST(DeviceFiles, TheXmlIsWellFormedAndAndroidBpParsesAsFormatted) {
  std::string out;
  int status = runTool("xmllint", "--noout", bpList("vintf_fragments").at(0), &out);
  ASSERT_NE(status, 127) << "xmllint is missing (scripts/deps.sh installs it)";
  EXPECT_EQ(status, 0) << out;
  out.clear();
  status = runTool("bpfmt", "-d", "Android.bp", &out);
  ASSERT_NE(status, 127) << "bpfmt is missing (scripts/deps.sh installs blueprint-tools)";
  EXPECT_EQ(status, 0) << out;
  EXPECT_EQ(out, "") << "bpfmt would format Android.bp differently";
}

TEST(DeviceFiles, SelinuxLabelsTheBinaryAndTheDaemonsDevicesWithDeclaredTypes) {
  const std::string te = readFile("android/sepolicy/hal_secure_element_qvese.te");
  std::vector<std::pair<std::regex, std::string>> labels;  // whole path -> type
  for (const std::string& l : lines(readFile("android/sepolicy/file_contexts"))) {
    if (l.empty() || l[0] == '#') continue;
    const auto m = findFirst("^([^ ]+) +u:object_r:([a-z0-9_]+):s0$", l);
    ASSERT_EQ(m.size(), 3u) << l;
    labels.emplace_back(std::regex(m[1]), m[2]);
    EXPECT_NE(te.find("type " + m[2] + ","), std::string::npos) << m[2];
  }
  auto labelOf = [&](const std::string& path) {
    for (const auto& e : labels)
      if (std::regex_match(path, e.first)) return e.second;
    return std::string();
  };
  EXPECT_EQ(labelOf("/vendor/bin/hw/" + kBinary), "hal_secure_element_qvese_exec");
  for (const char* dev : {MODEM0_AT_DEV_PATH, MODEM1_AT_DEV_PATH, "/sys/nfc/nfc_sim_switch"}) {
    EXPECT_FALSE(labelOf(dev).empty()) << dev;
  }
  EXPECT_NE(te.find("init_daemon_domain(hal_secure_element_qvese)"), std::string::npos);
}

}  // namespace
