#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <map>
#include <set>
#include <stdexcept>
#include <string>
#include <vector>

#include "faults.h"
#include "ldtr.h"
#include "platform.h"
#include "records.h"
#include "test_ldtr.h"
#include "trace_scope.h"

using testing::ElementsAre;
using testing::Field;
using testing::IsEmpty;
using testing::SizeIs;

namespace {

using Scope43 = ldtr_function_local<kId, 43, kEntryExit43>;

testing::Matcher<Record> isExit(uint64_t type, uint64_t id, const void* object, long code) {
  return isRecord(type, id, object, std::string(reinterpret_cast<const char*>(&code), sizeof code));
}

// ---- Layout ----

TEST(Layout, ScopeIsItsCodeAndItsObject) {
  const Records records(0);
  Scope33 scope(&an_object);
  scope.SetErrorCode(-5);
  EXPECT_THAT(words<2>(scope), ElementsAre(static_cast<uintptr_t>(-5L), word(&an_object)));
}

TEST(Layout, FormattersAreIdTypeObjectAndTypeAlone) {
  EXPECT_THAT(words<3>(ldtr_formater_local(kId, kType, &an_object)),
              ElementsAre(kId, kType, word(&an_object)));
  EXPECT_THAT(words<1>(ldtr_formater_global(kType)), ElementsAre(kType));
  static_assert(sizeof(ldtr_function_global) == sizeof(long));
}

// ---- Scopes ----

TEST(RecordTypes, FollowTheClass) {
  EXPECT_EQ(ldtr_entry_type(33), 0x3200000U);
  EXPECT_EQ(ldtr_entry_type(43), 0x32A0000U);
  EXPECT_EQ(ldtr_exit_type(33), 0x3210000U);
  EXPECT_EQ(ldtr_exit_type(43), 0x32B0000U);
  EXPECT_EQ(ldtr_exit_error_type(33), 0x30B0000U);
  EXPECT_EQ(ldtr_exit_error_type(43), 0x30C0000U);
  EXPECT_EQ(LDTR_TYPE_DEBUG, 0x3400000U);
  EXPECT_EQ(LDTR_TYPE_DEBUG_ERROR, 0x3070000U);
  EXPECT_EQ(LDTR_LEVEL_ORDINARY, 0xC8010000U);
  EXPECT_EQ(LDTR_LEVEL_ERROR, 0xC8110000U);
}

TEST(Scope, WritesOnlyTheExitRecordByItself) {
  const Records records;
  {
    Scope33 scope(&an_object);
    EXPECT_THAT(records.all(), IsEmpty());
    EXPECT_EQ(scope.SetErrorCode(0x123456789AL), 0x123456789AL);
  }
  EXPECT_THAT(records.all(), ElementsAre(isExit(0x30B0000, kId, &an_object, 0x123456789AL)));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(Scope, HasTheCodeZeroAtFirstAndTheLastOneThatWasStored) {
  const Records records;
  { const Scope33 scope(nullptr); }
  {
    Scope33 scope(nullptr);
    scope.SetErrorCode(1);
    scope.SetErrorCode(-99);
  }
  EXPECT_THAT(records.all(), ElementsAre(isExit(0x3210000, kId, nullptr, 0),
                                         isExit(0x30B0000, kId, nullptr, -99)));
}

struct ExitCase {
  uint64_t events;
  long code;
  uint64_t type33;  // 0: no record
  uint64_t type43;
};

TEST(Scope, ExitTypeDependsOnTheTwoBitsOfItsClassAndOnTheCode) {
  const ExitCase cases[] = {
      {0, 1, 0, 0},
      {kDebug, 1, 0, 0},
      {0x1000, 0, 0x3210000, 0},
      {0x1000, 1, 0x3210000, 0},
      {0x2000, 0, 0x3210000, 0},
      {0x2000, 1, 0x30B0000, 0},
      {0x2000, -1, 0x30B0000, 0},
      {0x3000, 0, 0x3210000, 0},
      {0x3000, 1, 0x30B0000, 0},
      {0x10000, 0, 0, 0x32B0000},
      {0x10000, 1, 0, 0x32B0000},
      {0x20000, 0, 0, 0x32B0000},
      {0x20000, 1, 0, 0x30C0000},
      {0x30000, 1, 0, 0x30C0000},
      {~uint64_t{0x33000}, 1, 0, 0},
  };
  for (const ExitCase& one : cases) {
    SCOPED_TRACE(testing::Message() << std::hex << one.events << " code " << one.code);
    Records records(one.events);
    { Scope33(nullptr).SetErrorCode(one.code); }
    if (one.type33 == 0) {
      EXPECT_THAT(records.all(), IsEmpty());
    } else {
      EXPECT_THAT(records.all(), ElementsAre(isExit(one.type33, kId, nullptr, one.code)));
    }
    records.clear();
    { Scope43(nullptr).SetErrorCode(one.code); }
    if (one.type43 == 0) {
      EXPECT_THAT(records.all(), IsEmpty());
    } else {
      EXPECT_THAT(records.all(), ElementsAre(isExit(one.type43, kId, nullptr, one.code)));
    }
  }
}

TEST(Scope, EachBitOfTheMaskAloneSwitchesItsOwnEvents) {
  const std::map<uint64_t, std::vector<std::string>> switched = {
      {0x1000, {"> copyFile", "< copyFile 5"}},
      {0x2000, {"<! copyFile 5"}},
      {0x10000, {"> trimLastDirectory", "< trimLastDirectory 5"}},
      {0x20000, {"<! trimLastDirectory 5"}},
  };
  for (int bit = 0; bit < 64; ++bit) {
    SCOPED_TRACE(bit);
    const uint64_t events = uint64_t{1} << bit;
    const Records records(events);
    { osutils::TraceScope<osutils::traced::copyFile>().result(5); }
    { osutils::TraceScope<osutils::traced::trimLastDirectory>().result(5); }
    const auto expected = switched.find(events);
    EXPECT_EQ(records.trail(),
              expected == switched.end() ? std::vector<std::string>() : expected->second);
    EXPECT_TRUE(ldtr_traces(events));
    EXPECT_FALSE(ldtr_traces(~events));
    DEBUG_MESSAGE(ldtr_fun, "message\n");
    EXPECT_THAT(records.prints(), SizeIs(events == kDebug ? 1 : 0));
  }
}

TEST(Scope, ReadsTheMaskAfreshAtItsEnd) {
  const Records records(0);
  {
    const Scope33 scope(nullptr);
    __atomic_store_n(&trcEvents, kEntryExit33, __ATOMIC_RELAXED);
  }
  EXPECT_THAT(records.all(), SizeIs(1));
  {
    const Scope33 scope(nullptr);
    __atomic_store_n(&trcEvents, 0, __ATOMIC_RELAXED);
  }
  EXPECT_THAT(records.all(), SizeIs(1));
}

TEST(Scope, WritesTheExitRecordWhenAnExceptionLeaves) {
  const Records records;
  EXPECT_THROW(
      {
        Scope33 scope(nullptr);
        scope.SetErrorCode(80);
        throw std::runtime_error("leaving");
      },
      std::runtime_error);
  EXPECT_THAT(records.all(), ElementsAre(isExit(0x30B0000, kId, nullptr, 80)));
}

TEST(Scope, GivesAFormatterWithItsIdAndObject) {
  const Records records(0);
  Scope43 scope(&an_object);
  EXPECT_THAT(words<3>(scope(0x32A0000)), ElementsAre(kId, 0x32A0000, word(&an_object)));
}

TEST(ExitErrcode, TakesItsTypeFromTheNextHigherBitOfTheMaskAlone) {
  const Records records(0x40);
  ldtr_exit_errcode(kId, 33, 0x20, 7, &an_object);
  ldtr_exit_errcode(kId, 33, 0x20, 0, &an_object);
  ldtr_exit_errcode(kId, 43, 0x40, 7, &an_object);  // 0x80 is off
  ldtr_exit_errcode(0xFFFFFFFFFFFF, 129, 0x20, -1, nullptr);
  EXPECT_THAT(records.all(), ElementsAre(isExit(0x30B0000, kId, &an_object, 7),
                                         isExit(0x3210000, kId, &an_object, 0),
                                         isExit(0x32B0000, kId, &an_object, 7),
                                         isExit(0x3140000, 0xFFFFFFFFFFFF, nullptr, -1)));
}

// ---- TraceScope ----

TEST(TraceScope, WritesEntryAndExitRoundTheResult) {
  const Records records;
  {
    osutils::TraceScope<osutils::traced::getEnvVar> trace;
    EXPECT_THAT(records.all(),
                ElementsAre(testing::AllOf(isRecord(0x3200000, 0x3E040100, nullptr, ""),
                                           Field("hasData", &Record::hasData, false))));
    EXPECT_EQ(trace.result(-3), -3);
  }
  EXPECT_THAT(records.trail(), ElementsAre("> getEnvVar", "<! getEnvVar -3"));
}

TEST(TraceScope, OfClass43HasABitOfItsOwn) {
  const Records records(kEntryExit43);
  { const osutils::TraceScope<osutils::traced::getEnvVar> ordinary; }
  { const osutils::TraceScope<osutils::traced::EtcServices_freeServicesEntries> frequent; }
  EXPECT_THAT(records.all(), ElementsAre(isRecord(0x32A0000, 0x3E010B00, nullptr, ""),
                                         isExit(0x32B0000, 0x3E010B00, nullptr, 0)));
}

TEST(TraceScope, RecordsAFlagAsOneOrZero) {
  const Records records;
  {
    osutils::TraceScope<osutils::traced::isFile> trace;
    EXPECT_TRUE(trace.result(true));
  }
  EXPECT_EQ(records.exitCode(), 1);
  {
    osutils::TraceScope<osutils::traced::isFile> trace;
    EXPECT_FALSE(trace.result(false));
  }
  EXPECT_EQ(records.exitCode(), 0);
}

TEST(TraceScope, WithOnlyTheErrorBitHasNoEntryRecord) {
  const Records records(kExitError33);
  {
    osutils::TraceScope<osutils::traced::putEnvVar> trace;
    trace.result(89);
  }
  { const osutils::TraceScope<osutils::traced::putEnvVar> trace; }
  EXPECT_THAT(records.all(), ElementsAre(isExit(0x30B0000, 0x3E040200, nullptr, 89),
                                         isExit(0x3210000, 0x3E040200, nullptr, 0)));
}

TEST(TraceScope, MessagesCarryTheirLevelAndTheFunction) {
  const Records records(kDebug);
  {
    osutils::TraceScope<osutils::traced::copyFile> trace;
    DEBUG_MESSAGE(trace, "copyFile: %d\n", 1);
    ERROR_MESSAGE(trace, "copyFile: %s\n", "two");
  }
  EXPECT_THAT(records.all(),
              ElementsAre(isRecord(0x3400000, 0x3E060700, nullptr, "copyFile: 1\n"),
                          isRecord(0x3070000, 0x3E060700, nullptr, "copyFile: two\n")));
  EXPECT_THAT(records.prints(), ElementsAre(isPrint(0xC8010000, "copyFile: 1\n"),
                                            isPrint(0xC8110000, "copyFile: two\n")));
}

TEST(TraceScope, MessagesDoNotEvaluateTheirArgumentsUnlessDebugIsOn) {
  const Records records(kAllEvents & ~kDebug);
  int evaluated = 0;
  {
    osutils::TraceScope<osutils::traced::copyFile> trace;
    DEBUG_MESSAGE(trace, "copyFile: %d\n", ++evaluated);
    ERROR_MESSAGE(ldtr_fun, "copyFile: %d\n", ++evaluated);
  }
  EXPECT_EQ(evaluated, 0);
  EXPECT_THAT(records.trail(), ElementsAre("> copyFile", "< copyFile 0"));
}

TEST(TraceScope, WithTracingOffNothingIsCalled) {
  const Records records(0);
  const FailingCall allocations(Call::allocation, ENOMEM);
  const FailingCall locks(Call::pthread_mutex_lock, EINVAL);
  {
    osutils::TraceScope<osutils::traced::copyFile> trace;
    DEBUG_MESSAGE(trace, "copyFile: message\n");
    trace.result(1);
  }
  EXPECT_EQ(allocations.calls(), 0);
  EXPECT_EQ(locks.calls(), 0);
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(TraceFunctions, HaveIdsAndNamesOfTheirOwn) {
  std::set<unsigned long> ids;
  std::set<std::string> names;
  std::vector<std::string> of_class_43;
  size_t count = 0;
#define TRACE_FUNCTION(module, ordinal, trace_class, recorded, identifier, name) \
  ++count;                                                                       \
  ids.insert(osutils::traced::identifier.id);                                    \
  names.insert(name);                                                            \
  EXPECT_EQ(osutils::traced::identifier.id >> 24, 0x3EU) << name;                \
  EXPECT_EQ(osutils::traced::identifier.id & 0xFF, 0U) << name;                  \
  if (trace_class == 43) of_class_43.push_back(name);
#include "trace_functions.def"
#undef TRACE_FUNCTION
  EXPECT_THAT(ids, SizeIs(count));
  EXPECT_THAT(names, SizeIs(count));
  EXPECT_THAT(of_class_43,
              testing::UnorderedElementsAre(
                  "getUsersPrimaryGroup", "isMemberOfGroup", "trimLastDirectory",
                  "EtcServices::getServicesEntry", "EtcServices::freeServicesEntries",
                  "EtcInittab::getInittabEntry", "EtcInittab::getInittabEntryWithCommand",
                  "EtcInittab::getEntryInitIDWithCommand", "EtcInittab::freeInittabEntries"));
}

// Readers need these numbers for old traces: module and ordinal never change.
TEST(TraceFunctions, KeepTheirNumbers) {
  const std::map<unsigned long, std::vector<std::string>> modules = {
      {1,
       {"EtcServices::EtcServices", "EtcServices::~EtcServices", "EtcServices::readEtcServices",
        "EtcServices::addService", "EtcServices::deleteService", "EtcServices::doesServiceExist",
        "EtcServices::getServicePort", "EtcServices::isPortAvaliable",
        "EtcServices::findAvaliablePort", "EtcServices::getServicesEntry",
        "EtcServices::freeServicesEntries"}},
      {2, {"getCurrentTimeStamp"}},
      {3,
       {"getTempDir", "getSystemDrive", "getLocalDrives", "getShortname",
        "getCurrentWorkingDirectory", "createDirectory", "deleteDirectory", "deleteDirForcefully",
        "createSymLink", "removeSymLink", "isEnoughDriveSpace", "trimLastDirectory"}},
      {4, {"getEnvVar", "putEnvVar"}},
      {5,
       {"getUsersPrimaryGroup", "isMemberOfGroup", "isValidUser", "doesUserExist", "getUserHomeDir",
        "doesGroupExist", "isValidName"}},
      {6,
       {"doesFileExist", "canAccessFile", "isDirectory", "isFile", "canWriteToFile",
        "checkFilePerms", "copyFile", "createFile", "deleteFile", "clearFile", "readFile",
        "getFileNameFromPath", "getFileOwnersAndPermissions", "setFileOwnersAndPermissions"}},
      {7,
       {"EtcInittab::EtcInittab", "EtcInittab::~EtcInittab", "EtcInittab::readInittab",
        "EtcInittab::addInittabEntry", "EtcInittab::deleteInittabEntry",
        "EtcInittab::doesInittabEntryExist", "EtcInittab::isCommandRegistered",
        "EtcInittab::findAvaliableID", "EtcInittab::getInittabEntry",
        "EtcInittab::getInittabEntryWithCommand", "EtcInittab::getEntryInitIDWithCommand",
        "EtcInittab::freeInittabEntries"}},
      {8,
       {"getVRAInstallPath", "getVRAVarBasePath", "getVRABaseSchemaDirPath", "getAdminLogsPath",
        "isRDBMComponentInstalled", "getVRAInstallLibPath", "getVRAInstallSbinPath",
        "getVRAVrarunFilePath", "getXQ4PathAndVersion", "isVersionValid"}},
      {10, {"loadSharedLib", "unloadSharedLib", "getSymAddress"}},
      {11,
       {"getAllIPAddresses", "getLocalHostIPAddress", "getAllIPAddresses_Linux",
        "isValidIPAddressOnSystem", "isValidIPAddressInList"}},
      {12, {"startProcess", "stopProcess", "isProcessStarted"}},
      {13, {"formatDn"}},
  };
  std::map<unsigned long, std::string> expected;
  for (const auto& [module, names] : modules) {
    for (size_t i = 0; i < names.size(); ++i) {
      expected[0x3E000000UL + (module << 16) + ((i + 1) << 8)] = names[i];
    }
  }

  std::map<unsigned long, std::string> numbers;
#define TRACE_FUNCTION(module, ordinal, trace_class, recorded, identifier, name) \
  numbers[osutils::traced::identifier.id] = name;
#include "trace_functions.def"
#undef TRACE_FUNCTION
  EXPECT_EQ(numbers, expected);
}

// ---- Threads ----

TEST(Threads, WriteTheirRecordsInOrder) {
  constexpr int kCalls = 200;
  const Records records;
  onAllThreads([](int thread) {
    for (int call = 0; call < kCalls; ++call) {
      osutils::TraceScope<osutils::traced::isFile> trace;
      DEBUG_MESSAGE(trace, "%d %d\n", thread, call);
      DEBUG_MESSAGE(ldtr_fun, "unscoped %d %d\n", thread, call);
      ldtr_fun.SetErrorCode(trace.result(call));
    }
  });

  int next[kThreads] = {};  // each thread writes every number twice
  for (const std::string& text : records.texts()) {
    int thread = -1;
    int call = -1;
    const char* const numbers = text.c_str() + text.find_first_of("0123456789");
    ASSERT_EQ(sscanf(numbers, "%d %d", &thread, &call), 2);
    ASSERT_TRUE(thread >= 0 && thread < kThreads);
    EXPECT_EQ(call, next[thread]++ / 2);
  }
  EXPECT_THAT(next, testing::Each(2 * kCalls));
  const std::vector<std::string> trail = records.trail();
  EXPECT_THAT(trail, SizeIs(kThreads * kCalls * 4));
  EXPECT_THAT(trail, testing::Each(testing::Not(testing::StartsWith("?"))));
}

TEST(Threads, MayTraceWhileTheMaskChanges) {
  const Records records(0);
  onAllThreads([](int thread) {
    for (int call = 0; call < 500; ++call) {
      if (thread == 0) {
        __atomic_store_n(&trcEvents, call % 2 == 0 ? kAllEvents : 0, __ATOMIC_RELAXED);
      }
      osutils::TraceScope<osutils::traced::isFile> trace;
      DEBUG_MESSAGE(trace, "%d\n", call);
    }
  });
  for (const Record& record : records.all()) {
    EXPECT_THAT(record.type, testing::AnyOf(0x3200000U, 0x3400000U, 0x3210000U));
  }
}

}  // namespace
