// --trace: the calls of the library that a command makes.
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>

#include <regex>
#include <sstream>
#include <string>
#include <vector>

#include "process_namespace.h"
#include "tool.h"
#include "tool_fixtures.h"
#include "world.h"

namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::StartsWith;

// The records of a trace in order: "> function" for an entry, "< function" for an exit.
std::vector<std::string> callsIn(const std::string& directory) {
  const Result result = runProgram({"/usr/bin/env", "babeltrace2", directory});
  EXPECT_EQ(result.status, 0) << result.err;
  const std::regex call(R"re(type = \( "(entry|exit|exit_error)" .*function = \( "([^"]+)" )re");
  std::vector<std::string> calls;
  std::istringstream lines(result.out);
  for (std::string line; std::getline(lines, line);) {
    std::smatch match;
    if (std::regex_search(line, match, call)) {
      calls.push_back((match[1] == "entry" ? "> " : "< ") + match[2].str());
    }
  }
  return calls;
}

// The calls of the tool itself, without nested calls.
std::vector<std::string> outerCalls(const std::vector<std::string>& calls) {
  std::vector<std::string> outer;
  int depth = 0;
  for (const std::string& call : calls) {
    if (call[0] == '<') {
      --depth;
    } else if (depth++ == 0) {
      outer.push_back(call.substr(2));
    }
  }
  EXPECT_EQ(depth, 0);
  return outer;
}

class Trace : public Tool {
 protected:
  void SetUp() override {
    if (runProgram({"/usr/bin/env", "babeltrace2", "--version"}).status != 0) {
      GTEST_SKIP() << "babeltrace2 is not installed";
    }
  }

  const std::string trace = temp.path("trace");
};

TEST_F(Trace, HoldsTheCallsOfACommandInOrder) {
  expectAnswer(services({"free-port", "--trace", trace, "53"}), "PORT\n54\n");
  EXPECT_THAT(callsIn(trace),
              ElementsAre("> EtcServices::EtcServices", "< EtcServices::EtcServices",  //
                          "> checkFilePerms", "> doesFileExist", "< doesFileExist", "> isDirectory",
                          "< isDirectory", "< checkFilePerms",  //
                          "> isFile", "< isFile",               //
                          "> EtcServices::readEtcServices",     //
                          "> EtcServices::freeServicesEntries",
                          "< EtcServices::freeServicesEntries",  //
                          "> checkFilePerms", "> doesFileExist", "< doesFileExist", "> isDirectory",
                          "< isDirectory", "< checkFilePerms",
                          "< EtcServices::readEtcServices",  //
                          "> EtcServices::findAvaliablePort", "> EtcServices::isPortAvaliable",
                          "< EtcServices::isPortAvaliable", "> EtcServices::isPortAvaliable",
                          "< EtcServices::isPortAvaliable",
                          "< EtcServices::findAvaliablePort",  //
                          "> EtcServices::~EtcServices", "> EtcServices::freeServicesEntries",
                          "< EtcServices::freeServicesEntries", "< EtcServices::~EtcServices"));
}

TEST_F(Trace, HoldsTheEditAndTheSecondReading) {
  const std::string deletion = temp.path("deletion");
  expectAnswer(services({"add", "--trace", trace, "vraslapd", "3700"}),
               "NAME      PORT\nvraslapd  3700\n");
  expectAnswer(services({"delete", "--trace", deletion, "--json", "vraslapd"}),
               "{\"deleted\":\"vraslapd\"}\n");

  EXPECT_THAT(outerCalls(callsIn(trace)),
              ElementsAre("checkFilePerms", "checkFilePerms", "isFile", "EtcServices::EtcServices",
                          "checkFilePerms", "isFile", "EtcServices::readEtcServices",
                          "EtcServices::doesServiceExist", "EtcServices::isPortAvaliable",
                          "EtcServices::addService", "EtcServices::EtcServices", "checkFilePerms",
                          "isFile", "EtcServices::readEtcServices", "EtcServices::getServicePort",
                          "EtcServices::~EtcServices", "EtcServices::~EtcServices"));
  EXPECT_THAT(outerCalls(callsIn(deletion)),
              ElementsAre("checkFilePerms", "checkFilePerms", "isFile", "EtcServices::EtcServices",
                          "checkFilePerms", "isFile", "EtcServices::readEtcServices",
                          "EtcServices::doesServiceExist", "EtcServices::deleteService",
                          "EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::doesServiceExist",
                          "EtcServices::~EtcServices", "EtcServices::~EtcServices"));
}

TEST_F(Trace, IsKeptWhenTheCommandFails) {
  expectFailure(services({"port", "--trace", trace, "vraslapd"}),
                StartsWith("osutils: services port: no such object (32): " + file));
  EXPECT_THAT(outerCalls(callsIn(trace)),
              ElementsAre("EtcServices::EtcServices", "checkFilePerms", "isFile",
                          "EtcServices::readEtcServices", "EtcServices::doesServiceExist",
                          "EtcServices::~EtcServices"));
}

TEST_F(Trace, RecordsOnlyTheEventsThatTheEnvironmentAsksFor) {
  const Result result =
      services({"free-port", "--trace", trace}, [] { setenv("TRC_EVENTS", "entry43", 1); });
  expectAnswer(result, "PORT\n3700\n");
  EXPECT_THAT(
      callsIn(trace),
      ElementsAre("> EtcServices::freeServicesEntries", "< EtcServices::freeServicesEntries",
                  "> EtcServices::freeServicesEntries", "< EtcServices::freeServicesEntries"));
}

TEST_F(Trace, HoldsTheCallsOfEveryFamily) {
  struct Case {
    Arguments arguments;
    std::vector<std::string> calls;
  };
  const std::string kept = temp.file("kept", "kept");
  const std::string copy = temp.path("copy");
  const std::string made = temp.path("made");
  const std::string inittab = temp.file("inittab", "id:2:initdefault:x\n");
  // The calls of a command on the inittab file. "" stands for the checks of the file.
  const auto inittabCalls = [](std::vector<std::string> methods) {
    methods.insert(methods.begin(), {"EtcInittab", "", "readInittab"});
    methods.push_back("~EtcInittab");
    std::vector<std::string> calls;
    for (const std::string& method : methods) {
      if (method.empty()) {
        calls.insert(calls.end(), {"checkFilePerms", "isFile"});
      } else {
        calls.push_back("EtcInittab::" + method);
      }
    }
    return calls;
  };
  const auto inittabEdit = [&](std::vector<std::string> methods) {
    std::vector<std::string> calls = inittabCalls(std::move(methods));
    calls.insert(calls.begin(), {"checkFilePerms", "checkFilePerms", "isFile"});
    return calls;
  };
  const Case cases[] = {
      {{"db"}, {"getXQ4PathAndVersion", "getVRAInstallPath", "checkFilePerms", "checkFilePerms"}},
      {{"file", "stat", kept},
       {"getFileNameFromPath", "doesFileExist", "canAccessFile", "isDirectory", "isFile"}},
      {{"file", "check", kept}, {"checkFilePerms"}},
      {{"file", "copy", kept, copy},
       {"checkFilePerms", "isFile", "checkFilePerms", "copyFile", "getFileOwnersAndPermissions"}},
      {{"file", "create", "--force", copy},
       {"checkFilePerms", "isFile", "createFile", "getFileOwnersAndPermissions"}},
      {{"file", "owner", kept}, {"getFileOwnersAndPermissions"}},
      {{"file", "owner", "--mode", "600", kept},
       {"getFileOwnersAndPermissions", "setFileOwnersAndPermissions",
        "getFileOwnersAndPermissions"}},
      {{"file", "clear", kept}, {"checkFilePerms", "isFile", "clearFile"}},
      {{"file", "delete", kept}, {"deleteFile"}},
      {{"dir", "create", made}, {"createDirectory", "getFileOwnersAndPermissions"}},
      {{"dir", "delete", made}, {"deleteDirectory"}},
      {{"dir", "delete", "--force", temp.dir("tree")}, {"deleteDirForcefully"}},
      {{"dir", "delete", "--force", temp.path() + "/#"}, {}},
      {{"dir", "trim", made}, {"trimLastDirectory"}},
      {{"space", "0", temp.path()}, {"doesFileExist", "isEnoughDriveSpace"}},
      {{"user", "exists", "root"}, {"doesUserExist"}},
      {{"user", "valid", "a;b"}, {"isValidUser"}},
      {{"user", "valid", "a b"}, {}},
      {{"user", "home", "root"}, {"doesUserExist", "getUserHomeDir"}},
      {{"user", "group", "root"}, {"getUsersPrimaryGroup"}},
      {{"group", "exists", "root"}, {"doesGroupExist"}},
      {{"group", "members", "root"}, {"doesGroupExist"}},
      {{"group", "has", "root", "root"}, {"doesGroupExist", "isMemberOfGroup"}},
      {{"name", "check", "inst1"}, {"isValidName"}},
      {{"screen", "a", "b"}, {}},
      {{"time"}, {"getCurrentTimeStamp"}},
      {{"inittab", "list", "--file", inittab}, inittabCalls({"getInittabEntryWithCommand"})},
      {{"inittab", "find", "--file", inittab, "x"}, inittabCalls({"getInittabEntryWithCommand"})},
      {{"inittab", "free-id", "--file", inittab}, inittabCalls({"findAvaliableID"})},
      {{"inittab", "add", "--file", inittab, "new", "2", "wait", "x"},
       inittabEdit({"doesInittabEntryExist", "addInittabEntry", "EtcInittab", "", "readInittab",
                    "getInittabEntry", "~EtcInittab"})},
      {{"inittab", "delete", "--file", inittab, "new"},
       inittabEdit({"doesInittabEntryExist", "deleteInittabEntry", "EtcInittab", "", "readInittab",
                    "doesInittabEntryExist", "~EtcInittab"})},
      {{"process", "start", "--launcher-dir", temp.path(), "a"}, {"startProcess"}},
      {{"process", "start", "--launcher-dir", temp.path(), "a b"}, {}},
      {{"process", "stop", std::to_string(kNoProcess)}, {"stopProcess"}},
      {{"process", "status", "1", "no-such-one"}, {"isProcessStarted"}},
      {{"platform"}, {}},
      {{"module", "check", "libc.so.6"}, {"loadSharedLib", "unloadSharedLib"}},
      {{"module", "check", "libc.so.6", "malloc"},
       {"loadSharedLib", "getSymAddress", "unloadSharedLib"}},
      {{"module", "check", temp.path("missing")}, {"loadSharedLib"}},
      {{"net", "addresses", "--localhost"}, {"getLocalHostIPAddress"}},
      {{"dn", "format", "a=b"}, {"formatDn"}},
      {{"dn", "compare", "a=b", "a=c"}, {"formatDn", "formatDn"}},
  };
  int number = 0;
  for (const Case& each : cases) {
    SCOPED_TRACE(::testing::PrintToString(each.arguments));
    const std::string directory = trace + std::to_string(++number);
    Arguments arguments = {"--trace", directory};
    arguments.insert(arguments.end(), each.arguments.begin(), each.arguments.end());
    (void)osutils(arguments);
    if (each.calls.empty()) {
      EXPECT_THAT(runProgram({"/usr/bin/env", "babeltrace2", directory}).out,
                  ::testing::Not(HasSubstr("\"entry\"")));
    } else {
      EXPECT_EQ(outerCalls(callsIn(directory)), each.calls);
    }
  }
}

TEST_F(Trace, HoldsNoCallOfARefusedStop) {
  REQUIRE_PROCESS_NAMESPACE();
  inProcessNamespace([this] {
    expectFailure(osutils({"process", "stop", "--trace", trace, "0"}),
                  StartsWith("osutils: process stop: parameter error (89): "));
  });
  EXPECT_TRUE(pathExists(trace));
  EXPECT_THAT(runProgram({"/usr/bin/env", "babeltrace2", trace}).out,
              ::testing::Not(HasSubstr("\"entry\"")));
}

TEST_F(Tool, ReportsATraceThatCannotBeStarted) {
  for (const std::string& directory :
       {temp.path("services/below"), std::string("/dev/null"), std::string()}) {
    SCOPED_TRACE(directory);
    expectFailure(
        services({"add", "--trace", directory, "vraslapd", "3700"}),
        "osutils: services add: operations error (1): cannot start tracing in " + directory + "\n");
  }
  EXPECT_EQ(contentsOf(file), kServices);
}

}  // namespace
