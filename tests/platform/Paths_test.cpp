#include "platform/Paths.h"

#include <gtest/gtest.h>
#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <optional>
#include <string>

namespace telvane {
namespace {

// Sets (or unsets) an environment variable for the life of the object.
class ScopedEnv {
 public:
  ScopedEnv(const char* name, std::optional<std::string> value) : name_(name) {
    if (const char* old = std::getenv(name)) old_ = old;
    if (value) setenv(name, value->c_str(), 1); else unsetenv(name);
  }
  ~ScopedEnv() {
    if (old_) setenv(name_, old_->c_str(), 1); else unsetenv(name_);
  }

 private:
  const char* name_;
  std::optional<std::string> old_;
};

TEST(Paths, ExpandTildeUsesHome) {
  ScopedEnv home("HOME", "/home/kim");
  EXPECT_EQ(expandTilde("~"), "/home/kim");
  EXPECT_EQ(expandTilde("~/Library/Caches/telvaned"), "/home/kim/Library/Caches/telvaned");
  EXPECT_EQ(expandTilde("/var/log"), "/var/log");
  EXPECT_EQ(expandTilde("relative/~"), "relative/~");
  EXPECT_EQ(expandTilde(""), "");
}

TEST(Paths, ExpandTildeWithTrailingSlashOrRootHome) {
  {
    ScopedEnv home("HOME", "/home/kim/");
    EXPECT_EQ(expandTilde("~/x"), "/home/kim/x");
  }
  {
    ScopedEnv home("HOME", "/");
    EXPECT_EQ(expandTilde("~/x"), "/x");
  }
}

TEST(Paths, ExpandTildeWithoutHomeUsesTheUserDatabase) {
  passwd* me = getpwuid(geteuid());
  if (!me || !me->pw_dir) GTEST_SKIP() << "no user database entry";
  std::string expected = std::string(me->pw_dir) + "/x";
  ScopedEnv home("HOME", std::nullopt);
  EXPECT_EQ(expandTilde("~/x"), expected);
}

TEST(Paths, ExpandTildeOfANamedUser) {
  passwd* root = getpwnam("root");
  if (!root || !root->pw_dir) GTEST_SKIP() << "no root entry";
  EXPECT_EQ(expandTilde("~root/x"), std::string(root->pw_dir) + "/x");
  EXPECT_EQ(expandTilde("~no-such-user-telvane/x"), "~no-such-user-telvane/x");
}

TEST(Paths, Defaults) {
  ScopedEnv home("HOME", "/home/kim");
  ScopedEnv a("TELVANED_CACHE_DIR", std::nullopt);
  ScopedEnv b("TELVANED_MESSAGE_LOG_DIR", std::nullopt);
  ScopedEnv c("TELVANED_STORAGE_DIR", std::nullopt);
  ScopedEnv d("TELVANED_SOCKET", std::nullopt);
  ScopedEnv e("TELVANED_ENTITLEMENTS_DIR", std::nullopt);
  ScopedEnv f("TELVANED_PUBLIC_KEY", std::nullopt);
  EXPECT_EQ(storebagCacheParentDir(), "/home/kim/Library/Caches/telvaned");
  EXPECT_EQ(messageLogDir(), "/var/mobile/Library/Logs/Mishapper/Retired");
  EXPECT_EQ(connectivityStorageDir(), "/tmp/tvxstorage");
  EXPECT_EQ(ipcSocketPath(), "/run/telvaned/com.zembra.telvaned");
  EXPECT_EQ(entitlementsDir(), "/etc/telvaned/entitlements.d");
  EXPECT_EQ(publicKeyPath(), std::string(TELVANE_DATADIR) + "/telvane/publicKey.der");
}

TEST(Paths, Overrides) {
  ScopedEnv home("HOME", "/home/kim");
  ScopedEnv a("TELVANED_CACHE_DIR", "/var/cache/telvaned");
  ScopedEnv b("TELVANED_MESSAGE_LOG_DIR", "/var/log/telvaned");
  ScopedEnv c("TELVANED_STORAGE_DIR", "~/storage");
  ScopedEnv d("TELVANED_SOCKET", "/tmp/t.sock");
  ScopedEnv e("TELVANED_ENTITLEMENTS_DIR", "/tmp/ent");
  ScopedEnv f("TELVANED_PUBLIC_KEY", "/tmp/key.der");
  EXPECT_EQ(storebagCacheParentDir(), "/var/cache/telvaned");
  EXPECT_EQ(messageLogDir(), "/var/log/telvaned");
  EXPECT_EQ(connectivityStorageDir(), "/home/kim/storage");
  EXPECT_EQ(ipcSocketPath(), "/tmp/t.sock");
  EXPECT_EQ(entitlementsDir(), "/tmp/ent");
  EXPECT_EQ(publicKeyPath(), "/tmp/key.der");
}

TEST(Paths, EmptyOverrideCountsAsUnset) {
  ScopedEnv a("TELVANED_STORAGE_DIR", "");
  ScopedEnv d("TELVANED_SOCKET", "");
  EXPECT_EQ(connectivityStorageDir(), "/tmp/tvxstorage");
  EXPECT_EQ(ipcSocketPath(), "/run/telvaned/com.zembra.telvaned");
}

}  // namespace
}  // namespace telvane
