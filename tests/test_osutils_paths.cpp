// The commands "paths" and "db".
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <string>

#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::AllOf;
using ::testing::HasSubstr;
using ::testing::StartsWith;

TEST_F(Layout, ShowsAllPathsAndWhatOfThemExists) {
  temp.dir("root/lib64");
  temp.file("root/lib64/libvradbutils.so", "");
  const auto line = [](const std::string& name, const std::string& path, bool exists) {
    return R"({"name":")" + name + R"(","path":")" + path + R"(","exists":)" +
           (exists ? "true" : "false") + "}";
  };
  const Result result = atRoot({"paths", "--json"});
  expectAnswer(
      result, "[" + line("install", root, true) + "," + line("lib", root + "/lib64", true) + "," +
                  line("sbin", root + "/sbin", false) + "," +
                  line("launcher", root + "/sbin/64/vrarun", false) + "," +
                  line("schema", root + "/etc/SchemaV6.1", false) + "," +
                  line("var", "/var/vraldap/V6.1", pathExists("/var/vraldap/V6.1")) + "," +
                  line("admin log", "/var/vraldap/V6.1/vraadm.log",
                       pathExists("/var/vraldap/V6.1/vraadm.log")) +
                  "," +
                  line("database log", "/var/vraldap/V6.1/vraadmxq4.log",
                       pathExists("/var/vraldap/V6.1/vraadmxq4.log")) +
                  "," +
                  line("database commands log", "/var/vraldap/V6.1/vraadmxq4cmds.log",
                       pathExists("/var/vraldap/V6.1/vraadmxq4cmds.log")) +
                  "," + line("database component", root + "/lib64/libvradbutils.so", true) + "]\n");
}

TEST_F(Layout, ShowsTheDefaultRootAndAnotherSchema) {
  const Result result = osutils({"paths", "--schema", "7"});
  EXPECT_EQ(result.status, 0);
  EXPECT_THAT(
      result.out,
      AllOf(StartsWith("NAME                   PATH"),
            HasSubstr("\nschema                 /opt/orx/ldap/V6.1/etc/SchemaV7 "),
            HasSubstr("\ndatabase component     /opt/orx/ldap/V6.1/lib64/libvradbutils.so")));
  EXPECT_EQ(result.err, "");
}

TEST_F(Layout, ShowsARootThatEndsWithASeparator) {
  for (const std::string separator : {"/", "\\"}) {
    const Result result =
        osutils({"paths"}, [&] { setenv("VRA_LDAP_HOME", (temp.path() + separator).c_str(), 1); });
    EXPECT_EQ(result.status, 0) << result.err;
    EXPECT_THAT(result.out, HasSubstr("\ninstall                " + temp.path() + " "));
  }
}

TEST_F(Layout, FindsTheDatabaseOfTheProductTheInstanceAndTheMigration) {
  const auto properties = [](const std::string& number) {
    return "currentXQ4Version=9." + number + "\ncurrentXQ4InstallPath=/opt/db" + number + "/\n";
  };
  writeFile(etc + "/ldapdb.properties", properties("1"));
  temp.dir("home");
  temp.dir("home/vraslapd-inst1");
  temp.dir("home/vraslapd-inst1/etc");
  temp.file("home/vraslapd-inst1/etc/ldapdb.properties", properties("2"));
  temp.dir("backup");
  temp.dir("backup/etc");
  temp.file("backup/etc/xq4info", properties("3"));

  expectAnswer(atRoot({"db"}), "PATH      VERSION\n/opt/db1  9.1\n");
  expectAnswer(atRoot({"db", "--instance", "inst1", "--location", temp.path("home")}),
               "PATH      VERSION\n/opt/db2  9.2\n");
  expectAnswer(atRoot({"db", "--migration", temp.path("backup"), "--json"}),
               R"({"path":"/opt/db3","version":"9.3"})"
               "\n");
}

TEST_F(Layout, NamesTheFileInWhichNoDatabaseWasFound) {
  const auto line = [](const std::string& path, const std::string& result) {
    return "osutils: db: no database path and version found in " + path +
           "; checkFilePerms returns " + result + " for " + path + "\n";
  };
  const std::string product = etc + "/ldapdb.properties";
  expectFailure(atRoot({"db"}), line(product, "no such object (32)"));
  for (const char* contents : {"", "currentXQ4InstallPath=/opt/db\n", "currentXQ4Version=9.1\n"}) {
    SCOPED_TRACE(contents);
    writeFile(product, contents);
    expectFailure(atRoot({"db"}),
                  "osutils: db: no such object (32): no database path and version found in " +
                      product + "\n");
  }
  expectFailure(atRoot({"db", "--instance", "a", "--location", temp.path()}),
                line(temp.path("vraslapd-a/etc/ldapdb.properties"), "no such object (32)"));
  temp.dir("xq4info");
  expectFailure(atRoot({"db", "--migration", temp.path(), "--json"}),
                line(temp.path("etc/xq4info"), "no such object (32)"));
}

TEST_F(Layout, AnInvalidVersionLeavesTheLibrarysMessageBeforeTheFailure) {
  const std::string product = etc + "/ldapdb.properties";
  writeFile(product, "currentXQ4InstallPath=/opt/db\ncurrentXQ4Version=nine\n");
  const Result result = atRoot({"db"});
  EXPECT_EQ(result.status, 3);
  EXPECT_EQ(result.out, "");
  EXPECT_EQ(result.err, "The file " + product +
                            " holds an invalid database version.\n"
                            "osutils: db: no such object (32): no database path and version "
                            "found in " +
                            product + "\n");
}

}  // namespace
