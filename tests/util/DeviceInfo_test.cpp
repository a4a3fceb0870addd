#include "util/DeviceInfo.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstring>
#include <limits>
#include <map>
#include <mutex>
#include <set>
#include <thread>
#include <vector>

#include "util/TelvaneError.h"

namespace telvane {
namespace {

const char* kId = "a8b02adab44459eea5733ba494e5a7c206f67fc3";  // 40 characters

DeviceInfo infoWith(std::map<std::string, std::string> answers) { return DeviceInfo(makeFixedDeviceFacts(std::move(answers))); }

TEST(DeviceInfo, GettersAskOneKeyEach) {
  DeviceInfo info = infoWith({{"UniqueDeviceID", "u"},
                              {"ProductVersion", "12"},
                              {"BuildVersion", "b1"},
                              {"ProductType", "pt"},
                              {"DeviceName", "laptop"},
                              {"HWModelStr", "hw"},
                              {"SerialNumber", "sn"},
                              {"ReleaseType", "Internal"}});
  EXPECT_EQ(info.uniqueDeviceID(), "u");
  EXPECT_EQ(info.productVersion(), "12");
  EXPECT_EQ(info.buildVersion(), "b1");
  EXPECT_EQ(info.productType(), "pt");
  EXPECT_EQ(info.deviceName(), "laptop");
  EXPECT_EQ(info.hwModelStr(), "hw");
  EXPECT_EQ(info.serialNumber(), "sn");
  EXPECT_EQ(info.releaseType(), "Internal");
  DeviceInfo empty = infoWith({});
  EXPECT_FALSE(empty.serialNumber().has_value());
  EXPECT_FALSE(empty.deviceName().has_value());
}

TEST(DeviceInfo, CopyUniqueDeviceIdIntoALargeBuffer) {
  DeviceInfo info = infoWith({{"UniqueDeviceID", kId}});
  std::vector<char> buffer(64, 'x');
  EXPECT_TRUE(info.copyUniqueDeviceID(buffer.data(), buffer.size()));
  EXPECT_STREQ(buffer.data(), kId);
  EXPECT_EQ(buffer[40], '\0');
  // Between the terminator and the last byte nothing changes; the last byte is zero.
  for (std::size_t i = 41; i < 63; ++i) EXPECT_EQ(buffer[i], 'x') << i;
  EXPECT_EQ(buffer[63], '\0');
}

TEST(DeviceInfo, CopyUniqueDeviceIdIntoAnExactBuffer) {
  DeviceInfo info = infoWith({{"UniqueDeviceID", kId}});
  std::vector<char> buffer(41, 'x');
  EXPECT_TRUE(info.copyUniqueDeviceID(buffer.data(), buffer.size()));
  EXPECT_EQ(std::string(buffer.data()), kId);
}

TEST(DeviceInfo, CopyUniqueDeviceIdIntoATooSmallBufferLeavesItAlone) {
  DeviceInfo info = infoWith({{"UniqueDeviceID", kId}});
  std::vector<char> buffer(40, 'x');
  EXPECT_FALSE(info.copyUniqueDeviceID(buffer.data(), buffer.size()));
  EXPECT_EQ(std::string(buffer.begin(), buffer.end()), std::string(40, 'x'));
  char one = 'x';
  EXPECT_FALSE(info.copyUniqueDeviceID(&one, 0));
  EXPECT_EQ(one, 'x');
}

TEST(DeviceInfo, CopyWithoutAnswerLeavesTheBufferUntouched) {
  DeviceInfo info = infoWith({});
  std::vector<char> buffer(64, 'x');
  EXPECT_FALSE(info.copyUniqueDeviceID(buffer.data(), buffer.size()));
  EXPECT_EQ(std::string(buffer.begin(), buffer.end()), std::string(64, 'x'));
}

TEST(DeviceInfo, CopyOfUtf8Text) {
  DeviceInfo info = infoWith({{"UniqueDeviceID", "d\xc3\xa9vice"}});  // 7 bytes
  char buffer[8];
  std::memset(buffer, 'x', sizeof buffer);
  EXPECT_TRUE(info.copyUniqueDeviceID(buffer, sizeof buffer));
  EXPECT_STREQ(buffer, "d\xc3\xa9vice");
  EXPECT_FALSE(info.copyUniqueDeviceID(buffer, 7));
}

TEST(DeviceInfo, InternalReleaseType) {
  EXPECT_TRUE(isInternalReleaseType(*makeFixedDeviceFacts({{"ReleaseType", "Internal"}})));
  EXPECT_FALSE(isInternalReleaseType(*makeFixedDeviceFacts({})));  // no answer: not internal
  EXPECT_FALSE(isInternalReleaseType(*makeFixedDeviceFacts({{"ReleaseType", "internal"}})));
  EXPECT_FALSE(isInternalReleaseType(*makeFixedDeviceFacts({{"ReleaseType", "Customer"}})));
  EXPECT_FALSE(isInternalReleaseType(*makeFixedDeviceFacts({{"ReleaseType", "Internal "}})));
}

TEST(DeviceInfo, InternalBuildIsComputedOnceFromTheSharedFacts) {
  const bool expected = isInternalReleaseType(*DeviceInfo::shared().facts());
  std::vector<std::thread> threads;
  std::vector<int> seen(8, -1);
  for (int i = 0; i < 8; ++i) threads.emplace_back([&seen, i] { seen[i] = isInternalBuild() ? 1 : 0; });
  for (auto& t : threads) t.join();
  for (int v : seen) EXPECT_EQ(v, expected ? 1 : 0);
  EXPECT_EQ(&DeviceInfo::shared(), &DeviceInfo::shared());
}

TEST(DeviceInfo, TimeValueToSeconds) {
  EXPECT_DOUBLE_EQ(secondsFromTimeValue(12, 500000), 12.5);
  EXPECT_DOUBLE_EQ(secondsFromTimeValue(0, 1), 0.000001);
  EXPECT_DOUBLE_EQ(secondsFromTimeValue(1'700'000'000, 250000), 1'700'000'000.25);
  EXPECT_DOUBLE_EQ(secondsFromTimeValue(-2, 500000), -1.5);
}

TEST(DeviceInfo, SanitizedTimeInterval) {
  EXPECT_EQ(sanitizedTimeInterval(std::numeric_limits<double>::infinity()), -1.0);
  EXPECT_EQ(sanitizedTimeInterval(-std::numeric_limits<double>::infinity()), -1.0);
  EXPECT_EQ(sanitizedTimeInterval(std::nan("")), -1.0);
  EXPECT_EQ(sanitizedTimeInterval(3.25), 3.25);
  EXPECT_EQ(sanitizedTimeInterval(-7.0), -7.0);
  EXPECT_EQ(sanitizedTimeInterval(0.0), 0.0);
}

TEST(DeviceInfo, TimestampCoarsening) {
  EXPECT_EQ(coarsenTimestamp(119, false), 60);
  EXPECT_EQ(coarsenTimestamp(119, true), 119);
  EXPECT_EQ(coarsenTimestamp(120, false), 120);
  EXPECT_EQ(coarsenTimestamp(59, false), 0);
  EXPECT_EQ(coarsenTimestamp(1'700'000'039, false), 1'699'999'980);
  // Truncation toward zero: negative times move up.
  EXPECT_EQ(coarsenTimestamp(-119, false), -60);
  EXPECT_EQ(coarsenTimestamp(-119, true), -119);
  EXPECT_EQ(coarsenTimestamp(119), isInternalBuild() ? 119 : 60);
}

TEST(DeviceInfo, ConnectivityClientKey) {
  Dictionary both{{"_clientName", "Conferal"}, {"_serviceName", "Calls.Video"}};
  EXPECT_EQ(connectivityClientKey(Value(both)), "conferal:calls.video");
  EXPECT_EQ(connectivityClientKey(Value(Dictionary{{"_clientName", "Music"}})), "music:");
  EXPECT_EQ(connectivityClientKey(Value(Dictionary{{"_serviceName", "SVC"}})), ":svc");
  EXPECT_EQ(connectivityClientKey(Value(Dictionary{})), ":");
  EXPECT_EQ(connectivityClientKey(Value()), ":");
  EXPECT_EQ(connectivityClientKey(Value(Dictionary{{"_clientName", 5}, {"_serviceName", "S"}})), ":s");
}

TEST(DeviceInfo, ProcessInstanceIdentifierIsOneUuidPerProcess) {
  std::set<std::string> seen;
  std::vector<std::thread> threads;
  std::mutex mutex;
  for (int i = 0; i < 8; ++i) {
    threads.emplace_back([&] {
      auto id = processInstanceIdentifier();
      std::lock_guard<std::mutex> lock(mutex);
      seen.insert(id);
    });
  }
  for (auto& t : threads) t.join();
  ASSERT_EQ(seen.size(), 1u);
  const std::string id = *seen.begin();
  EXPECT_EQ(id, processInstanceIdentifier());
  ASSERT_EQ(id.size(), 36u);
  for (std::size_t i = 0; i < id.size(); ++i) {
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      EXPECT_EQ(id[i], '-');
    } else {
      EXPECT_NE(std::string("0123456789ABCDEF").find(id[i]), std::string::npos) << id;
    }
  }
}

TEST(TelvaneError, MakeTelvaneError) {
  TelvaneError e = makeTelvaneError(-1, "storebag not available");
  EXPECT_EQ(e.domain, "TelvaneErrorDomain");
  EXPECT_EQ(e.code, -1);
  EXPECT_EQ(e.description, "storebag not available");
  EXPECT_EQ(makeTelvaneError(404, "x"), (TelvaneError{"TelvaneErrorDomain", 404, "x"}));
}

}  // namespace
}  // namespace telvane
