#include "platform/LinuxDeviceFacts.h"

#include <gtest/gtest.h>

#include <filesystem>
#include <string>

#include "platform/Log.h"
#include "support/TempDir.h"

namespace telvane {
namespace {

namespace fs = std::filesystem;
using test::TempDir;
using test::writeFile;

// A fake system tree under a temporary root.
class FakeRoot {
 public:
  void put(const std::string& relative, const std::string& text) {
    fs::path p = dir_.path() / relative;
    fs::create_directories(p.parent_path());
    writeFile(p, text);
  }
  std::string root() const { return dir_.str(); }
  std::string overridePath() const { return (dir_.path() / "device-info.conf").string(); }
  std::shared_ptr<DeviceFacts> facts() const { return makeLinuxDeviceFacts(overridePath(), root()); }

 private:
  TempDir dir_;
};

TEST(LinuxDeviceFacts, UniqueDeviceIdIsHmacOfTrimmedMachineId) {
  FakeRoot r;
  r.put("etc/machine-id", "0123456789abcdef0123456789abcdef\n");
  auto id = r.facts()->answer("UniqueDeviceID");
  ASSERT_TRUE(id.has_value());
  // HMAC-SHA1 of the machine id under "telvane.device-identity.v1".
  EXPECT_EQ(*id, "a8b02adab44459eea5733ba494e5a7c206f67fc3");
  EXPECT_EQ(id->find("0123456789abcdef"), std::string::npos);
}

TEST(LinuxDeviceFacts, NoMachineIdNoUniqueDeviceId) {
  FakeRoot r;
  r.put("etc/os-release", "VERSION_ID=12\n");
  EXPECT_FALSE(r.facts()->answer("UniqueDeviceID").has_value());
  r.put("etc/machine-id", "  \n");
  EXPECT_FALSE(r.facts()->answer("UniqueDeviceID").has_value());
}

TEST(LinuxDeviceFacts, VersionsFromOsRelease) {
  FakeRoot r;
  r.put("etc/os-release", "NAME=\"Debian GNU/Linux\"\nVERSION_ID=\"12\"\nBUILD_ID=2024-06-01\n");
  r.put("proc/sys/kernel/osrelease", "6.1.0-21-amd64\n");
  auto facts = r.facts();
  EXPECT_EQ(facts->answer("ProductVersion"), "12");
  EXPECT_EQ(facts->answer("BuildVersion"), "2024-06-01");
}

TEST(LinuxDeviceFacts, VersionsFallBackToKernelRelease) {
  FakeRoot r;
  r.put("usr/lib/os-release", "NAME=Debian\n");  // no /etc/os-release, no VERSION_ID
  r.put("proc/sys/kernel/osrelease", "6.1.0-21-amd64\n");
  auto facts = r.facts();
  EXPECT_EQ(facts->answer("ProductVersion"), "6.1.0-21-amd64");
  EXPECT_EQ(facts->answer("BuildVersion"), "6.1.0-21-amd64");
}

TEST(LinuxDeviceFacts, UsrLibOsReleaseIsReadWhenEtcHasNone) {
  FakeRoot r;
  r.put("usr/lib/os-release", "VERSION_ID='13'\n");
  EXPECT_EQ(r.facts()->answer("ProductVersion"), "13");
}

TEST(LinuxDeviceFacts, FakeRootWithoutKernelReleaseHasNoVersions) {
  FakeRoot r;
  auto facts = r.facts();
  EXPECT_FALSE(facts->answer("ProductVersion").has_value());
  EXPECT_FALSE(facts->answer("BuildVersion").has_value());
}

TEST(LinuxDeviceFacts, ProductTypeAndModelFromDmi) {
  FakeRoot r;
  r.put("sys/class/dmi/id/product_name", "ThinkPad X1 Carbon\n");
  r.put("sys/class/dmi/id/board_name", "20KH006MUS\n");
  r.put("proc/device-tree/model", std::string("Not used\0", 9));
  auto facts = r.facts();
  EXPECT_EQ(facts->answer("ProductType"), "ThinkPad X1 Carbon");
  EXPECT_EQ(facts->answer("HWModelStr"), "20KH006MUS");
}

TEST(LinuxDeviceFacts, ProductTypeAndModelFromDeviceTree) {
  FakeRoot r;
  r.put("proc/device-tree/model", std::string("Raspberry Pi 4 Model B Rev 1.4\0", 31));
  auto facts = r.facts();
  EXPECT_EQ(facts->answer("ProductType"), "Raspberry Pi 4 Model B Rev 1.4");
  EXPECT_EQ(facts->answer("HWModelStr"), "Raspberry Pi 4 Model B Rev 1.4");
}

TEST(LinuxDeviceFacts, DeviceTreeUnderSysFirmware) {
  FakeRoot r;
  r.put("sys/firmware/devicetree/base/model", std::string("Pine64 PinePhone\0", 17));
  EXPECT_EQ(r.facts()->answer("ProductType"), "Pine64 PinePhone");
}

TEST(LinuxDeviceFacts, DeviceNameFromMachineInfoChassis) {
  FakeRoot r;
  r.put("etc/machine-info", "PRETTY_HOSTNAME=\"Kim's box\"\nCHASSIS=\"vm\"\n");
  r.put("sys/class/dmi/id/chassis_type", "3\n");
  EXPECT_EQ(r.facts()->answer("DeviceName"), "vm");
}

TEST(LinuxDeviceFacts, DeviceNameFromDmiChassisType) {
  for (auto [type, word] : std::initializer_list<std::pair<const char*, const char*>>{
           {"3", "desktop"}, {"9", "laptop"}, {"10", "laptop"}, {"17", "server"}, {"23", "server"},
           {"30", "tablet"}, {"31", "convertible"}, {"2", "Linux"}, {"junk", "Linux"}}) {
    FakeRoot r;
    r.put("sys/class/dmi/id/chassis_type", std::string(type) + "\n");
    EXPECT_EQ(r.facts()->answer("DeviceName"), word) << "chassis type " << type;
  }
}

TEST(LinuxDeviceFacts, DeviceNameDefaultsToLinux) {
  FakeRoot r;
  EXPECT_EQ(r.facts()->answer("DeviceName"), "Linux");
}

TEST(LinuxDeviceFacts, ChassisWords) {
  EXPECT_EQ(LinuxDeviceFacts::chassisWord(8), "laptop");
  EXPECT_EQ(LinuxDeviceFacts::chassisWord(14), "laptop");
  EXPECT_EQ(LinuxDeviceFacts::chassisWord(28), "server");
  EXPECT_EQ(LinuxDeviceFacts::chassisWord(32), "convertible");
  EXPECT_EQ(LinuxDeviceFacts::chassisWord(11), "handset");
  EXPECT_FALSE(LinuxDeviceFacts::chassisWord(1).has_value());
  EXPECT_FALSE(LinuxDeviceFacts::chassisWord(99).has_value());
}

TEST(LinuxDeviceFacts, SerialNumberWhenReadable) {
  FakeRoot r;
  EXPECT_FALSE(r.facts()->answer("SerialNumber").has_value());
  r.put("sys/class/dmi/id/product_serial", "PF1ABCDE\n");
  EXPECT_EQ(r.facts()->answer("SerialNumber"), "PF1ABCDE");
}

TEST(LinuxDeviceFacts, ReleaseTypeOnlyFromOverrideFile) {
  FakeRoot r;
  r.put("etc/os-release", "VERSION_ID=12\nRELEASE_TYPE=Internal\nReleaseType=Internal\n");
  EXPECT_FALSE(r.facts()->answer("ReleaseType").has_value());
  writeFile(r.overridePath(), "ReleaseType=Internal\n");
  EXPECT_EQ(r.facts()->answer("ReleaseType"), "Internal");
}

TEST(LinuxDeviceFacts, OverrideFileWinsOverSystemSources) {
  FakeRoot r;
  r.put("etc/machine-id", "0123456789abcdef0123456789abcdef\n");
  r.put("sys/class/dmi/id/product_name", "Real Product\n");
  r.put("sys/class/dmi/id/product_serial", "REAL\n");
  r.put("etc/os-release", "VERSION_ID=12\n");
  writeFile(r.overridePath(),
            "# device maker settings\n"
            "\n"
            "  ProductType  =  Gadget 3000  \n"
            "UniqueDeviceID=fixed-id\n"
            "DeviceName=\"kiosk\"\n"
            "HWModelStr='GX-3'\n"
            "SerialNumber=\n"
            "CustomKey=custom\n");
  auto facts = r.facts();
  EXPECT_EQ(facts->answer("ProductType"), "Gadget 3000");
  EXPECT_EQ(facts->answer("UniqueDeviceID"), "fixed-id");
  EXPECT_EQ(facts->answer("DeviceName"), "kiosk");
  EXPECT_EQ(facts->answer("HWModelStr"), "GX-3");
  EXPECT_FALSE(facts->answer("SerialNumber").has_value());  // an empty value hides the key
  EXPECT_EQ(facts->answer("CustomKey"), "custom");
  EXPECT_EQ(facts->answer("ProductVersion"), "12");  // not overridden: the system source
}

TEST(LinuxDeviceFacts, BadOverrideLinesAreLoggedAndSkipped) {
  FakeRoot r;
  writeFile(r.overridePath(), "ProductType=A\nthis line has no equals sign\n# fine\n=orphan value\nDeviceName=B\n");
  log::LogCapture capture;
  auto facts = r.facts();
  EXPECT_TRUE(capture.contains(log::Level::Error, "LinuxDeviceFacts: Ignoring malformed line 2 of " + r.overridePath()));
  EXPECT_TRUE(capture.contains(log::Level::Error, "LinuxDeviceFacts: Ignoring malformed line 4 of " + r.overridePath()));
  EXPECT_EQ(capture.lines().size(), 2u);
  EXPECT_EQ(facts->answer("ProductType"), "A");
  EXPECT_EQ(facts->answer("DeviceName"), "B");
  EXPECT_FALSE(facts->answer("this line has no equals sign").has_value());
}

TEST(LinuxDeviceFacts, MissingOverrideFileIsQuiet) {
  FakeRoot r;
  log::LogCapture capture;
  auto facts = r.facts();
  EXPECT_EQ(facts->answer("DeviceName"), "Linux");
  EXPECT_TRUE(capture.lines().empty());
}

TEST(LinuxDeviceFacts, OverrideFileIsReadAtCreationAndSystemFilesOnce) {
  FakeRoot r;
  writeFile(r.overridePath(), "ProductType=First\n");
  r.put("sys/class/dmi/id/board_name", "Board A\n");
  auto facts = r.facts();
  EXPECT_EQ(facts->answer("HWModelStr"), "Board A");
  writeFile(r.overridePath(), "ProductType=Second\n");
  r.put("sys/class/dmi/id/board_name", "Board B\n");
  EXPECT_EQ(facts->answer("ProductType"), "First");
  EXPECT_EQ(facts->answer("HWModelStr"), "Board A");
  // A new instance sees the new files.
  EXPECT_EQ(r.facts()->answer("ProductType"), "Second");
  EXPECT_EQ(r.facts()->answer("HWModelStr"), "Board B");
}

TEST(LinuxDeviceFacts, ParseOverridesKeepsEmptyValuesAndStripsQuotes) {
  auto parsed = LinuxDeviceFacts::parseOverrides("A=\"x y\"\nB=\nC='q'\nD=\"unbalanced\n", "test");
  EXPECT_EQ(parsed.at("A"), "x y");
  EXPECT_EQ(parsed.at("B"), "");
  EXPECT_EQ(parsed.at("C"), "q");
  EXPECT_EQ(parsed.at("D"), "\"unbalanced");
}

TEST(LinuxDeviceFacts, SystemFactsAnswerOnThisMachine) {
  auto facts = DeviceFacts::system();
  ASSERT_NE(facts, nullptr);
  EXPECT_EQ(facts, DeviceFacts::system());
  // DeviceName always has an answer, whatever the machine.
  auto name = facts->answer("DeviceName");
  ASSERT_TRUE(name.has_value());
  EXPECT_FALSE(name->empty());
  if (fs::exists("/etc/machine-id")) {
    auto id = facts->answer("UniqueDeviceID");
    if (id) {
      EXPECT_EQ(id->size(), 40u);
      EXPECT_EQ(id->find_first_not_of("0123456789abcdef"), std::string::npos);
    }
  }
}

TEST(FixedDeviceFacts, AnswersFromTheTableOnly) {
  auto facts = makeFixedDeviceFacts({{"ReleaseType", "Internal"}, {"DeviceName", "tv"}});
  EXPECT_EQ(facts->answer("ReleaseType"), "Internal");
  EXPECT_EQ(facts->answer("DeviceName"), "tv");
  EXPECT_FALSE(facts->answer("SerialNumber").has_value());
}

}  // namespace
}  // namespace telvane
