// The directory rules every layer takes from StandardPaths: a BX_* variable wins, an empty variable counts as
// unset, and each directory honours only its own variable (a service directory that followed BX_RUNTIME_DIR would
// move every socket when a test only meant to move the notifications).

#include <gtest/gtest.h>
#include <unistd.h>

#include <cstdlib>
#include <map>
#include <optional>
#include <string>

#include "base/StandardPaths.h"

namespace bexil {
namespace {

namespace fs = std::filesystem;

// Sets variables for one test and puts back what was there.
class Environment {
  public:
    ~Environment() {
        for (const auto& [name, value] : saved_) {
            if (value)
                ::setenv(name.c_str(), value->c_str(), 1);
            else
                ::unsetenv(name.c_str());
        }
    }
    void set(const std::string& name, const char* value) {
        if (!saved_.contains(name)) {
            const char* old = ::getenv(name.c_str());
            saved_[name] = old ? std::optional<std::string>(old) : std::nullopt;
        }
        if (value)
            ::setenv(name.c_str(), value, 1);
        else
            ::unsetenv(name.c_str());
    }

  private:
    std::map<std::string, std::optional<std::string>> saved_;
};

TEST(StandardPaths, EachDirectoryFollowsItsOwnVariableAndEmptyMeansUnset) {
    Environment env;
    env.set("BX_RUNTIME_DIR", "/r");
    env.set("BX_SERVICE_DIR", "/s");
    env.set("BX_PREFERENCES_DIR", "/p");
    env.set("BX_ENTITLEMENTS_DIR", "/e");
    EXPECT_EQ(runtimeDirectory(), fs::path("/r"));
    EXPECT_EQ(serviceDirectory(), fs::path("/s"));
    EXPECT_EQ(preferencesDirectory(), fs::path("/p"));
    EXPECT_EQ(entitlementsDirectory(), fs::path("/e"));

    env.set("BX_SERVICE_DIR", "");
    env.set("BX_PREFERENCES_DIR", "");
    env.set("BX_ENTITLEMENTS_DIR", nullptr);
    env.set("XDG_RUNTIME_DIR", "/xdg-run");
    env.set("XDG_CONFIG_HOME", "");
    env.set("HOME", "/home/someone");
    EXPECT_EQ(serviceDirectory(), geteuid() == 0 ? fs::path("/run/bexil") : fs::path("/xdg-run/bexil"))
        << "the service directory does not follow BX_RUNTIME_DIR";
    EXPECT_EQ(preferencesDirectory(), fs::path("/home/someone/.config/bexil/preferences"));
    EXPECT_EQ(entitlementsDirectory(), fs::path("/etc/bexil/entitlements.d"));
    env.set("XDG_CONFIG_HOME", "/cfg");
    EXPECT_EQ(preferencesDirectory(), fs::path("/cfg/bexil/preferences"));
}

TEST(StandardPaths, DataDirectoriesSkipEmptyEntriesAndHaveADefault) {
    Environment env;
    env.set("XDG_DATA_DIRS", ":/a::/b/:");
    EXPECT_EQ(dataDirectories(), (std::vector<fs::path>{"/a", "/b/"}));
    env.set("XDG_DATA_DIRS", "");
    EXPECT_EQ(dataDirectories(), (std::vector<fs::path>{"/usr/local/share", "/usr/share"}));
}

}  // namespace
}  // namespace bexil
