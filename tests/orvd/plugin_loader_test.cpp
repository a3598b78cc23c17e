// Loading a plug-in, and every way in which it can be unfit.
#include <dlfcn.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <string>

#include "plugin/loader.h"
#include "slapi/owners.h"

namespace orv::server {
namespace {

using ::testing::EndsWith;
using ::testing::HasSubstr;
using ::testing::StartsWith;

constexpr const char* kInit = "test_plugin_init";

std::string built(const std::string& name) {
  return std::string(ORV_TEST_PLUGINS) + "/" + name + ".so";
}

bool is_mapped(const std::string& path) {
  void* library = dlopen(path.c_str(), RTLD_NOW | RTLD_NOLOAD);
  if (library == nullptr) return false;
  dlclose(library);
  return true;
}

class PluginLoader : public ::testing::Test {
 protected:
  LoadedPlugin load(const std::string& path, const char* init = kInit) {
    return load_plugin(path, init, pb_.get(), error_);
  }

  void expect_refused(const std::string& path, PluginMessage number, const std::string& reason) {
    SCOPED_TRACE(path);
    EXPECT_FALSE(load(path));
    EXPECT_EQ(error_.number, number);
    EXPECT_THAT(error_.text, StartsWith(std::to_string(static_cast<int>(number)) + " "));
    EXPECT_THAT(error_.text, HasSubstr(reason));
    expect_no_handlers();
    EXPECT_FALSE(std::filesystem::is_regular_file(path) && is_mapped(path));
  }

  void expect_no_handlers() {
    for (const int number : {200, 201, 202, 203, 204, 205, 206, 207, 208, 209, 210, -15, -16}) {
      EXPECT_EQ(slapi_pblock_handler(pb_.get(), number), nullptr) << number;
    }
    EXPECT_EQ(slapi_pblock_instance_start(pb_.get()), nullptr);
  }

  PblockPtr pb_{slapi_pblock_new()};
  PluginError error_;
};

TEST_F(PluginLoader, GoodPluginIsLoadedWithItsHandlers) {
  {
    const LoadedPlugin plugin = load(built("good"));
    ASSERT_TRUE(plugin) << error_.text;
    EXPECT_EQ(error_.number, PluginMessage::none);
    const Handler search = slapi_pblock_handler(pb_.get(), parameter::search_function);
    ASSERT_NE(search, nullptr);
    EXPECT_EQ(search(pb_.get()), 0);
    EXPECT_TRUE(is_mapped(built("good")));
  }
  EXPECT_FALSE(is_mapped(built("good"))) << "the owner closes the library";
}

TEST_F(PluginLoader, ReleasedPluginStaysMapped) {
  LoadedPlugin plugin = load(built("good"));
  void* library = plugin.release();
  EXPECT_FALSE(plugin);
  plugin = LoadedPlugin();
  EXPECT_TRUE(is_mapped(built("good")));
  dlclose(library);
}

TEST_F(PluginLoader, MovedOwnerClosesOnce) {
  LoadedPlugin first = load(built("good"));
  LoadedPlugin second(std::move(first));
  EXPECT_TRUE(second);
  LoadedPlugin third;
  third = std::move(second);
  EXPECT_TRUE(third);
}

TEST_F(PluginLoader, MissingFileIsRefused) {
  expect_refused(built("nowhere"), PluginMessage::no_file, "No such file");
}

TEST_F(PluginLoader, EmptyPathIsRefused) {
  expect_refused("", PluginMessage::no_file, "No such file");
}

TEST_F(PluginLoader, DirectoryIsRefused) {
  expect_refused(ORV_TEST_PLUGINS, PluginMessage::not_a_regular_file, "not a regular file");
}

TEST_F(PluginLoader, BareNameMeansTheCurrentFolderAndNotTheSystems) {
  expect_refused("libc.so.6", PluginMessage::no_file, "No such file");
}

TEST_F(PluginLoader, FileThatIsNoLibraryIsRefused) {
  const std::string path = ::testing::TempDir() + "/orv_not_a_library.so";
  std::ofstream(path) << "dn: cn=configuration\n";
  expect_refused(path, PluginMessage::not_loadable, "orv_not_a_library");
  std::remove(path.c_str());
}

TEST_F(PluginLoader, LibraryWithAMissingSymbolIsRefusedAtLoad) {
  expect_refused(built("missing_symbol"), PluginMessage::not_loadable,
                 "orv_test_function_that_nobody_defines");
}

TEST_F(PluginLoader, LibraryWithoutEntryPointIsRefused) {
  expect_refused(built("no_entry_point"), PluginMessage::no_entry_point, kInit);
}

TEST_F(PluginLoader, EntryPointOfOtherLinkageIsRefused) {
  expect_refused(built("cxx_entry_point"), PluginMessage::no_entry_point, kInit);
}

TEST_F(PluginLoader, EntryPointThatFailsIsRefusedAndItsHandlersTakenBack) {
  expect_refused(built("returns_failure"), PluginMessage::entry_point_failed, "returned 17");
}

TEST_F(PluginLoader, EntryPointThatThrowsIsRefusedWithItsReason) {
  expect_refused(built("throws_exception"), PluginMessage::entry_point_threw,
                 "threw: nothing works here");
}

TEST_F(PluginLoader, EntryPointThatThrowsSomethingElseIsRefused) {
  expect_refused(built("throws_number"), PluginMessage::entry_point_threw, "threw");
  EXPECT_THAT(error_.text, EndsWith("threw"));
}

TEST_F(PluginLoader, EveryHandlerThatTheServerNeedsIsMissed) {
  const struct {
    const char* plugin;
    const char* reason;
  } kCases[] = {{"no_bind", "no bind handler (parameter 200)"},
                {"no_unbind", "no unbind handler (parameter 201)"},
                {"no_search", "no search handler (parameter 202)"},
                {"no_modify", "no modify handler (parameter 204)"},
                {"no_add", "no add handler (parameter 206)"},
                {"no_delete", "no delete handler (parameter 207)"},
                {"no_close", "no close handler (parameter 210)"},
                {"no_instance_start", "no instance start handler (parameter -19)"}};
  for (const auto& c : kCases) {
    expect_refused(built(c.plugin), PluginMessage::missing_handler, c.reason);
  }
}

TEST_F(PluginLoader, LaterPluginIsLoadedAfterARefusedOne) {
  EXPECT_FALSE(load(built("no_search")));
  EXPECT_TRUE(load(built("good"))) << error_.text;
}

}  // namespace
}  // namespace orv::server
