#include <dlfcn.h>
#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <link.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>

#include <atomic>
#include <functional>
#include <map>
#include <set>
#include <stdexcept>
#include <string>
#include <thread>
#include <utility>
#include <vector>

#include "faults.h"
#include "ldtr.h"
#include "platform.h"
#include "records.h"
#include "trace_scope.h"

namespace {

using testing::ElementsAre;
using testing::Field;
using testing::IsEmpty;
using testing::SizeIs;

constexpr unsigned long kId = 0x3E7F0500;
constexpr unsigned long kType = 0x3400000;
constexpr int kErrno = 77;
const int an_object = 0;
const int another_object = 0;

using Scope33 = ldtr_function_local<kId, 33, kEntryExit33>;
using Scope43 = ldtr_function_local<kId, 43, kEntryExit43>;

// What every record has besides its own four properties: the last four arguments are zero.
testing::Matcher<Record> isRecord(uint64_t type, uint64_t id, const void* object,
                                  const std::string& text) {
  return testing::AllOf(Field("type", &Record::type, type), Field("id", &Record::id, id),
                        Field("object", &Record::object, object),
                        Field("data", &Record::data, text), Field("rest", &Record::rest, 0U));
}

testing::Matcher<Record> isExit(uint64_t type, uint64_t id, const void* object, long code) {
  return isRecord(type, id, object, std::string(reinterpret_cast<const char*>(&code), sizeof code));
}

testing::Matcher<Print> isPrint(unsigned int level, const std::string& text) {
  return testing::AllOf(Field("level", &Print::level, level), Field("text", &Print::text, text));
}

// Formats on purpose with texts that a compiler would refuse.
#pragma GCC diagnostic push
#pragma GCC diagnostic ignored "-Wformat-nonliteral"

void writeText(unsigned long type, unsigned long id, const void* object, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  ldtr_write(type, id, object, format, arguments);
  va_end(arguments);
}

int safer(int size, char* dst, const char* format, ...) {
  va_list arguments;
  va_start(arguments, format);
  const int result = safer_vsprintf(size, dst, format, arguments);
  va_end(arguments);
  return result;
}

#pragma GCC diagnostic pop

// No wide character: it cannot be converted in any locale.
const wchar_t kUnprintable[] = {static_cast<wchar_t>(0x7FFFFFFF), 0};

// ---- layout ----

// The words of an object, to show the order of its fields.
template <size_t Count, typename T>
std::vector<uintptr_t> words(const T& object) {
  static_assert(sizeof(T) == Count * sizeof(uintptr_t));
  std::vector<uintptr_t> result(Count);
  memcpy(result.data(), static_cast<const void*>(&object), sizeof object);
  return result;
}

uintptr_t word(const void* pointer) { return reinterpret_cast<uintptr_t>(pointer); }

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

// ---- records of a scope ----

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

// ---- the library's own scope ----

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
#define TRACE_FUNCTION(module, ordinal, trace_class, identifier, name) \
  ++count;                                                             \
  ids.insert(osutils::traced::identifier.id);                          \
  names.insert(name);                                                  \
  EXPECT_EQ(osutils::traced::identifier.id >> 24, 0x3EU) << name;      \
  EXPECT_EQ(osutils::traced::identifier.id & 0xFF, 0U) << name;        \
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

// Numbers that old traces are read with: module and ordinal never change.
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
#define TRACE_FUNCTION(module, ordinal, trace_class, identifier, name) \
  numbers[osutils::traced::identifier.id] = name;
#include "trace_functions.def"
#undef TRACE_FUNCTION
  EXPECT_EQ(numbers, expected);
}

// ---- ldtr_write ----

TEST(Write, WithoutFormatHasNoData) {
  const Records records(0);  // it does not ask the mask
  ldtr_write(kType, kId, &an_object);
  EXPECT_THAT(records.all(), ElementsAre(testing::AllOf(isRecord(kType, kId, &an_object, ""),
                                                        Field(&Record::hasData, false))));
}

TEST(Write, PassesAllSixtyFourBitsOn) {
  const Records records(0);
  ldtr_write(0xFEDCBA9876543210, 0x0123456789ABCDEF, nullptr);
  EXPECT_THAT(records.all(),
              ElementsAre(isRecord(0xFEDCBA9876543210, 0x0123456789ABCDEF, nullptr, "")));
}

TEST(Write, RecordsTheTextWithoutItsNul) {
  const Records records(0);
  writeText(kType, kId, &an_object, "%s=%d\n", "answer", 42);
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &an_object, "answer=42\n")));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(Write, RecordsAnEmptyTextAsDataOfNoLength) {
  const Records records(0);
  writeText(kType, kId, nullptr, "");
  EXPECT_THAT(records.all(), ElementsAre(testing::AllOf(isRecord(kType, kId, nullptr, ""),
                                                        Field(&Record::hasData, true))));
}

TEST(Write, EndsTheDataAtANulInTheText) {
  const Records records(0);
  writeText(kType, kId, nullptr, "before%cafter", '\0');
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, nullptr, "before")));
}

std::string formatError(int rc) {
  return "Error - ldtr_write: Debug format error - buffer is 8192 bytes rc=" + std::to_string(rc) +
         "\n";
}

TEST(Write, ReplacesATextOfMoreThan8192Characters) {
  const std::pair<int, std::string> cases[] = {
      {8190, std::string(8190, 'x')}, {8191, std::string(8191, 'x')},
      {8192, std::string(8191, 'x')},  // passes, but the buffer has room for one less
      {8193, formatError(8193)},      {1'000'000, formatError(1'000'000)},
  };
  for (const auto& [length, data] : cases) {
    SCOPED_TRACE(length);
    const Records records(0);
    writeText(kType, kId, &an_object, "%s", std::string(static_cast<size_t>(length), 'x').c_str());
    EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &an_object, data)));
  }
}

TEST(Write, ReplacesATextThatCannotBeFormatted) {
  const Records records(0);
  writeText(kType, kId, nullptr, "%ls", kUnprintable);
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, nullptr, formatError(-1))));
}

TEST(Write, ReplacesATextThatThePlatformRefusesToFormat) {
  const Records records(0);
  const FailingCall format(Call::vra_vsnprintf, EIO);
  writeText(kType, kId, nullptr, "%s", "fine");
  ASSERT_TRUE(format.fired());
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, nullptr, formatError(-1))));
}

TEST(Write, WithoutMemoryLeavesTheRecordOut) {
  REQUIRE_OWN_MALLOC();
  const Records records(0);
  const FailingCall memory(Call::calloc, ENOMEM);
  const FailingCall format(Call::vra_vsnprintf, EIO, 1000);
  writeText(kType, kId, nullptr, "%s", "lost");
  ASSERT_TRUE(memory.fired());
  EXPECT_EQ(format.calls(), 0);
  EXPECT_THAT(records.all(), IsEmpty());
}

TEST(Write, AllocatesOneBufferAndFreesIt) {
  REQUIRE_OWN_MALLOC();
  const Records records(0);
  const FailingCall allocations(Call::allocation, ENOMEM, 1000);
  const LiveAllocations live;
  writeText(kType, kId, nullptr, "%s", "text");
  writeText(kType, kId, nullptr, "%s", std::string(9000, 'x').c_str());
  EXPECT_EQ(allocations.calls(), 2);
  EXPECT_EQ(live.blocks(), 0);
}

// ---- formatters ----

TEST(LocalFormatter, WritesARecordWithoutData) {
  const Records records;
  ldtr_formater_local(kId, kType, &an_object)();
  EXPECT_THAT(records.all(), ElementsAre(testing::AllOf(isRecord(kType, kId, &an_object, ""),
                                                        Field(&Record::hasData, false))));
}

TEST(LocalFormatter, WritesTheText) {
  const Records records;
  ldtr_formater_local(kId, kType, &an_object)("%d-%s", 1, "a");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &an_object, "1-a")));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(LocalFormatter, PutsTheLowByteOfTheSubNumberIntoTheId) {
  const Records records;
  ldtr_formater_local formatter(kId | 0x01, kType, &an_object);
  formatter(0xABCD34UL, "%d-%s", 2, "b");
  formatter(0xFF00UL, "%d-%s", 3, "c");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId | 0x35, &an_object, "2-b"),
                                         isRecord(kType, kId | 0x01, &an_object, "3-c")));
}

TEST(LocalFormatter, NewDeleteIsAboutTheGivenPointer) {
  const Records records;
  ldtr_formater_local formatter(kId, kType, &an_object);
  formatter.new_delete(&another_object, "%d-%s", 4, "d");
  formatter.new_delete(0x1142UL, &another_object, "%d-%s", 5, "e");
  formatter.new_delete(static_cast<const void*>(nullptr), "%d", 6);
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &another_object, "4-d"),
                                         isRecord(kType, kId | 0x42, &another_object, "5-e"),
                                         isRecord(kType, kId, nullptr, "6")));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(LocalFormatter, DebugAddsTheLowByteOfTheLevelAndPrints) {
  const Records records;
  ldtr_formater_local(kId, kType, &an_object).debug(0xC8010000, "%d-%s\n", 7, "f");
  ldtr_formater_local(kId, kType, &an_object).debug(0xC8010042, "%d-%s\n", 8, "g");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, kId, &an_object, "7-f\n"),
                                         isRecord(kType, kId | 0x42, &an_object, "8-g\n")));
  EXPECT_THAT(records.prints(),
              ElementsAre(isPrint(0xC8010000, "7-f\n"), isPrint(0xC8010042, "8-g\n")));
}

TEST(LocalFormatter, DebugAtTheErrorLevelChangesTheTypeForGood) {
  const Records records;
  ldtr_formater_local formatter(kId, 0x5123456, &an_object);
  formatter.debug(0xC8110001, "near\n");
  formatter.debug(0xC8110000, "error\n");
  formatter.debug(0xC8010000, "after\n");
  formatter();
  EXPECT_THAT(records.all(), ElementsAre(isRecord(0x5123456, kId | 1, &an_object, "near\n"),
                                         isRecord(0x5070000, kId, &an_object, "error\n"),
                                         isRecord(0x5070000, kId, &an_object, "after\n"),
                                         isRecord(0x5070000, kId, &an_object, "")));
  EXPECT_THAT(records.prints(),
              ElementsAre(isPrint(0xC8110001, "near\n"), isPrint(0xC8110000, "error\n"),
                          isPrint(0xC8010000, "after\n")));
}

TEST(GlobalFormatter, WritesTheTextUnderTheGivenId) {
  const Records records;
  ldtr_formater_global formatter(kType);
  formatter(0x123456789AUL, "%d-%s", 1, "a");
  formatter.new_delete(0x1142UL, &another_object, "%d-%s", 2, "b");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, 0x123456789A, nullptr, "1-a"),
                                         isRecord(kType, 0x1142, &another_object, "2-b")));
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST(GlobalFormatter, DebugTakesTheWholeLevelAsTheId) {
  const Records records;
  ldtr_fun(kType).debug(0xC8010042, "%d-%s\n", 3, "c");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(kType, 0xC8010042, nullptr, "3-c\n")));
  EXPECT_THAT(records.prints(), ElementsAre(isPrint(0xC8010042, "3-c\n")));
}

TEST(GlobalFormatter, DebugAtTheErrorLevelChangesTheTypeForGood) {
  const Records records;
  ldtr_formater_global formatter(kType);
  formatter.debug(0xC8110000, "error\n");
  formatter(5UL, "after");
  EXPECT_THAT(records.all(), ElementsAre(isRecord(0x3070000, 0xC8110000, nullptr, "error\n"),
                                         isRecord(0x3070000, 5, nullptr, "after")));
  EXPECT_THAT(records.prints(), ElementsAre(isPrint(0xC8110000, "error\n")));
}

TEST(Debug, WritesTheRecordBeforeThePrint) {
  const Records records;
  {
    osutils::TraceScope<osutils::traced::isFile> trace;
    trace(LDTR_TYPE_DEBUG).debug(LDTR_LEVEL_ORDINARY, "scoped\n");
    ldtr_fun(LDTR_TYPE_DEBUG).debug(LDTR_LEVEL_ERROR, "unscoped message\n");
  }
  // A print that does not directly follow its record would give a line with a question mark.
  EXPECT_THAT(records.trail(),
              ElementsAre("> isFile", "D scoped\n", "E unscoped message\n", "< isFile 0"));
}

TEST(Debug, PrintsWithoutARecordWhenThereIsNoMemoryForIt) {
  REQUIRE_OWN_MALLOC();
  const Records records;
  FailingCall memory(Call::calloc, ENOMEM, 1, 2);
  ldtr_formater_local(kId, kType, nullptr).debug(0xC8010000, "local %d\n", 1);
  ldtr_formater_global(kType).debug(0xC8110000, "global %d\n", 2);
  memory.disarm();
  ASSERT_EQ(memory.calls(), 2);
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(),
              ElementsAre(isPrint(0xC8010000, "local 1\n"), isPrint(0xC8110000, "global 2\n")));
}

TEST(Debug, PrintsTheWholeTextWhoseRecordWasReplaced) {
  const std::string text(10'000, 'x');
  const Records records;
  ldtr_fun(kType).debug(0xC8010000, "%s", text.c_str());
  EXPECT_THAT(records.texts(), ElementsAre(formatError(10'000)));
  EXPECT_THAT(records.prints(), ElementsAre(isPrint(0xC8010000, text)));
}

TEST(Errno, IsTheSameAfterEveryOperation) {
  const Records records;
  ldtr_formater_local local(kId, kType, nullptr);
  ldtr_formater_global global(kType);
  const std::function<void()> operations[] = {
      [&] { ldtr_write(kType, kId, nullptr); },
      [&] { writeText(kType, kId, nullptr, "%d", 1); },
      [&] { ldtr_exit_errcode(kId, 33, 0x1000, 1, nullptr); },
      [&] { local(); },
      [&] { local("%d", 1); },
      [&] { local(1UL, "%d", 1); },
      [&] { local.new_delete(&an_object, "%d", 1); },
      [&] { local.new_delete(1UL, &an_object, "%d", 1); },
      [&] { local.debug(LDTR_LEVEL_ORDINARY, "%d", 1); },
      [&] { global(1UL, "%d", 1); },
      [&] { global.new_delete(1UL, &an_object, "%d", 1); },
      [&] { global.debug(LDTR_LEVEL_ERROR, "%d", 1); },
      [&] { const Scope33 scope(nullptr); },
      [&] { const osutils::TraceScope<osutils::traced::isFile> trace; },
  };
  int number = 0;
  for (const auto& operation : operations) {
    SCOPED_TRACE(number++);
    const size_t before = records.all().size();
    errno = kErrno;
    operation();
    const int after = errno;
    EXPECT_EQ(after, kErrno);
    EXPECT_GT(records.all().size(), before);
  }
}

TEST(Errno, IsTheSameAfterARecordThatWasLeftOut) {
  REQUIRE_OWN_MALLOC();
  const FailingCall memory(Call::calloc, ENOMEM);
  errno = kErrno;
  writeText(kType, kId, nullptr, "%d", 1);
  const int after = errno;
  ASSERT_TRUE(memory.fired());
  EXPECT_EQ(after, kErrno);
}

TEST(GlobalScope, StoresEveryCodeIntoTheOneObject) {
  ldtr_function_global other;
  EXPECT_EQ(ldtr_fun.SetErrorCode(5), 5);
  EXPECT_THAT(words<1>(ldtr_fun), ElementsAre(5U));
  EXPECT_EQ(other.SetErrorCode(-7), -7);
  EXPECT_THAT(words<1>(ldtr_fun), ElementsAre(static_cast<uintptr_t>(-7L)));
  EXPECT_THAT(words<1>(other), ElementsAre(0U));
  EXPECT_EQ(ldtr_fun.SetErrorCode(0), 0);
}

TEST(Init, GivesTheAnswerOfTheTraceLibrary) {
  for (const int answer : {0, 7, -1}) {
    const int calls = trcInitCalls;
    trcInitAnswer = answer;
    EXPECT_EQ(ldtr_init(), answer);
    EXPECT_EQ(trcInitCalls, calls + 1);
  }
  trcInitAnswer = 0;
}

// ---- safer_vsprintf ----

class SaferVsprintf : public testing::Test {
 protected:
  SaferVsprintf() : text_(100'000, 'z') {}

  // As large as any text here, so that an overrun of the announced size stays inside.
  char* dst() { return text_.data(); }
  std::string result() const { return text_.c_str(); }

  std::string text_;
};

TEST_F(SaferVsprintf, FormatsLikeItsModel) {
  EXPECT_EQ(safer(100, dst(), "%d, %s and %5.2f", 1, "two", 3.0), 0);
  EXPECT_EQ(result(), "1, two and  3.00");
}

TEST_F(SaferVsprintf, RefusesWhatItIsNotGivenInThisOrder) {
  EXPECT_EQ(safer(0, nullptr, nullptr), 1);
  EXPECT_EQ(safer(10, nullptr, "x"), 1);
  EXPECT_EQ(safer(0, dst(), nullptr), 2);
  EXPECT_EQ(safer(-1, dst(), "x"), 2);
  EXPECT_EQ(safer(1, dst(), nullptr), 3);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
}

TEST_F(SaferVsprintf, WantsAFormatShorterThanTheBuffer) {
  EXPECT_EQ(safer(10, dst(), "0123456789"), 5);
  EXPECT_EQ(safer(1, dst(), "0"), 5);
  EXPECT_EQ(safer(500, dst(), std::string(500, 'x').c_str()), 5);  // before 6
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(safer(10, dst(), "012345678"), 0);
  EXPECT_EQ(result(), "012345678");
}

TEST_F(SaferVsprintf, WantsAFormatOfAtMost499Characters) {
  EXPECT_EQ(safer(1000, dst(), std::string(500, 'x').c_str()), 6);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(safer(1000, dst(), std::string(499, 'x').c_str()), 0);
  EXPECT_EQ(result(), std::string(499, 'x'));
}

TEST_F(SaferVsprintf, WantsRoomForTheBoundBeforeEachConversion) {
  EXPECT_EQ(safer(1000, dst(), (std::string(492, 'x') + "%s").c_str(), "y"), 7);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(safer(1000, dst(), (std::string(491, 'x') + "%s").c_str(), "y"), 0);
  EXPECT_EQ(result(), std::string(491, 'x') + "y");
}

TEST_F(SaferVsprintf, WantsRoomForTheTail) {
  EXPECT_EQ(safer(1000, dst(), ("%s" + std::string(492, 'x')).c_str(), "y"), 7);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(safer(1000, dst(), ("%s" + std::string(491, 'x')).c_str(), "y"), 0);
  EXPECT_EQ(result(), "y" + std::string(491, 'x'));
}

// Calls with as many "%s" as indices, each printing "y".
template <size_t... Index>
int saferMany(char* dst, std::index_sequence<Index...>) {
  std::string format;
  for (size_t count = 0; count < sizeof...(Index); ++count) format += "%s";
  return safer(1000, dst, format.c_str(), (static_cast<void>(Index), "y")...);
}

TEST_F(SaferVsprintf, HasRoomFor62Bounds) {
  EXPECT_EQ(saferMany(dst(), std::make_index_sequence<63>()), 7);
  EXPECT_EQ(text_, std::string(100'000, 'z'));
  EXPECT_EQ(saferMany(dst(), std::make_index_sequence<62>()), 0);
  EXPECT_EQ(result(), std::string(62, 'y'));
}

TEST_F(SaferVsprintf, CutsEveryPlainStringAt1000Characters) {
  for (const size_t length : {999U, 1000U, 1001U, 2000U, 50'000U}) {
    SCOPED_TRACE(length);
    const std::string argument(length, 'a');
    const std::string printed(length < 1000 ? length : 1000, 'a');
    EXPECT_EQ(safer(10'000, dst(), "<%s|%s>", argument.c_str(), argument.c_str()), 0);
    EXPECT_EQ(result(), "<" + printed + "|" + printed + ">");
  }
}

TEST_F(SaferVsprintf, LeavesStringsWithFlagsWidthOrPrecisionAsTheyAre) {
  const std::string argument(2000, 'a');
  EXPECT_EQ(safer(10'000, dst(), "%-1s", argument.c_str()), 0);
  EXPECT_EQ(result(), argument);
  EXPECT_EQ(safer(10'000, dst(), "%1500s", "b"), 0);
  EXPECT_EQ(result(), std::string(1499, ' ') + "b");
  EXPECT_EQ(safer(10'000, dst(), "%.1200s", argument.c_str()), 0);
  EXPECT_EQ(result(), std::string(1200, 'a'));
}

TEST_F(SaferVsprintf, PassesOverADoubledPercentSign) {
  EXPECT_EQ(safer(100, dst(), "100%%s"), 0);
  EXPECT_EQ(result(), "100%s");
  const std::string argument(2000, 'a');
  EXPECT_EQ(safer(10'000, dst(), "%%%s%%%%s", argument.c_str()), 0);
  EXPECT_EQ(result(), "%" + std::string(1000, 'a') + "%%s");
}

TEST_F(SaferVsprintf, WritesAnEmptyTextForAnEmptyFormat) {
  EXPECT_EQ(safer(1, dst(), ""), 0);
  EXPECT_EQ(result(), "");
  EXPECT_EQ(text_[1], 'z');
}

TEST_F(SaferVsprintf, PassesAPercentSignAtTheEndOnToItsModel) {
  EXPECT_EQ(safer(100, dst(), "50%"), 8);  // glibc refuses it
}

TEST_F(SaferVsprintf, ReportsATextThatCannotBeFormatted) {
  EXPECT_EQ(safer(100, dst(), "%ls", kUnprintable), 8);
}

TEST_F(SaferVsprintf, ReportsATextThatHasOverrunTheBuffer) {
  EXPECT_EQ(safer(10, dst(), "%s", "012345678"), 0);
  EXPECT_EQ(result(), "012345678");
  EXPECT_EQ(safer(10, dst(), "%s", "0123456789"), 9);
  EXPECT_EQ(result(), "0123456789");  // the damage is done
  EXPECT_EQ(safer(1000, dst(), "%s", std::string(2000, 'a').c_str()), 9);
  EXPECT_EQ(safer(1001, dst(), "%s", std::string(2000, 'a').c_str()), 0);
}

TEST_F(SaferVsprintf, MissesAnOverrunThatLeavesTheLastByteZero) {
  EXPECT_EQ(safer(4, dst(), "%c%c", 'a', 'b'), 5);  // the format itself is too long
  EXPECT_EQ(safer(5, dst(), "%s", "abcd\0"), 0);
  EXPECT_EQ(safer(6, dst(), "%3d%c", 1, '\0'), 0);
  EXPECT_EQ(safer(6, dst(), "%5d%c", 1, '\0'), 0);
  EXPECT_EQ(safer(7, dst(), "%6d%c", 1, '\0'), 0);
}

// ---- AutoLock ----

constexpr char kMoreSeconds[] =
    "Couldn't get access to mutex controlled resource (still busy). Will wait for 30 more seconds.";
constexpr char kExpired[] =
    "Couldn't get access to mutex controlled resource (wait of 60 seconds expired.)";

class Lock : public testing::Test {
 protected:
  Lock() {
    unsetenv("AUTOLOCKTYPE");
    default_autolock = 0;
    configfile_read = 1;
    al_configfile_counter = 0;
  }
  ~Lock() override { unsetenv("AUTOLOCKTYPE"); }

  // Asked from another thread: a thread may lock a mutex it holds.
  bool isHeld() {
    int rc = 0;
    std::thread([&] {
      rc = pthread_mutex_trylock(&mutex_);
      if (rc == 0) pthread_mutex_unlock(&mutex_);
    }).join();
    return rc == EBUSY;
  }

  std::string failedTry(int phase, const char* delay) {
    char text[200];
    snprintf(text, sizeof text, "D %d failed to trylock%d %p, waiting %s\n",
             static_cast<int>(pthread_self()), phase, static_cast<void*>(&mutex_), delay);
    return text;
  }

  std::vector<std::string> waiting(int first, bool first_over, int second) {
    std::vector<std::string> lines(static_cast<size_t>(first), failedTry(1, "0.1s"));
    if (first_over) lines.push_back(std::string("D ") + kMoreSeconds + "\n");
    lines.insert(lines.end(), static_cast<size_t>(second), failedTry(2, "1s"));
    return lines;
  }

  pthread_mutex_t mutex_ = PTHREAD_MUTEX_INITIALIZER;
};

using AutoLockTest = Lock;
using LockType = Lock;

TEST_F(AutoLockTest, OfANullMutexDoesNothing) {
  const Records records;
  const FailingCall lock(Call::pthread_mutex_lock, EINVAL);
  const FailingCall trylock(Call::pthread_mutex_trylock, EINVAL);
  const FailingCall unlock(Call::pthread_mutex_unlock, EINVAL);
  const FailingCall setting(Call::ldap_getenv, EINVAL);
  { const AutoLock timed(nullptr, true); }
  { const AutoLock untimed(nullptr, false); }
  EXPECT_EQ(lock.calls(), 0);
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(unlock.calls(), 0);
  EXPECT_EQ(setting.calls(), 0);
  EXPECT_EQ(al_configfile_counter, 0);
  EXPECT_EQ(default_autolock, 0);
  EXPECT_THAT(records.trail(), IsEmpty());
}

TEST_F(AutoLockTest, UntimedHoldsTheMutexForItsScope) {
  const FailingCall trylock(Call::pthread_mutex_trylock, EBUSY);
  const FailingCall setting(Call::ldap_getenv, EINVAL);
  {
    const AutoLock lock(&mutex_, false);
    EXPECT_TRUE(isHeld());
  }
  EXPECT_FALSE(isHeld());
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(setting.calls(), 0);
  EXPECT_EQ(al_configfile_counter, 0);
}

TEST_F(AutoLockTest, ReleasesWhenAnExceptionLeavesTheScope) {
  EXPECT_THROW(
      {
        const AutoLock lock(&mutex_, false);
        throw std::runtime_error("leaving");
      },
      std::runtime_error);
  EXPECT_FALSE(isHeld());
}

TEST_F(AutoLockTest, TimedTakesAFreeMutexAtOnce) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall lock_calls(Call::pthread_mutex_lock, EINVAL);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
    EXPECT_EQ(default_autolock, 1);
    EXPECT_EQ(al_configfile_counter, 1);
  }
  EXPECT_FALSE(isHeld());
  EXPECT_EQ(lock_calls.calls(), 0);
  EXPECT_EQ(sleep.calls(), 0);
  EXPECT_THAT(records.trail(), IsEmpty());
}

TEST_F(AutoLockTest, TimedWithRegularLockBlocksWithoutMessages) {
  setenv("AUTOLOCKTYPE", "REGULARLOCK", 1);
  const Records records;
  const FakeSleep sleep;
  const FailingCall trylock(Call::pthread_mutex_trylock, EBUSY);
  std::atomic<int> step = 0;
  std::thread holder([&] {
    pthread_mutex_lock(&mutex_);
    step = 1;
    step.notify_all();
    step.wait(1);
    pthread_mutex_unlock(&mutex_);
  });
  step.wait(0);
  const BeforeCall release(Call::pthread_mutex_lock, [&] {
    step = 2;
    step.notify_all();
  });
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  holder.join();
  EXPECT_TRUE(release.fired());
  EXPECT_EQ(default_autolock, 0);
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(sleep.calls(), 0);
  EXPECT_THAT(records.trail(), IsEmpty());
}

TEST_F(AutoLockTest, TimedWithALockTypeOtherThanOneBlocks) {
  default_autolock = 2;
  al_configfile_counter = 1;
  const FailingCall trylock(Call::pthread_mutex_trylock, EBUSY);
  const FailingCall lock_calls(Call::pthread_mutex_lock, EINVAL, 1000);
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(default_autolock, 2);
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(lock_calls.calls(), 1);
}

TEST_F(AutoLockTest, TimedReadsTheSettingOncePerConfiguration) {
  const FailingCall setting(Call::ldap_getenv, EINVAL, 1000);
  { const AutoLock lock(&mutex_, true); }
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(setting.calls(), 1);
  EXPECT_EQ(default_autolock, 1);

  setenv("AUTOLOCKTYPE", "REGULARLOCK", 1);
  configfile_read = 2;
  { const AutoLock lock(&mutex_, true); }
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(setting.calls(), 2);
  EXPECT_EQ(default_autolock, 0);
}

TEST_F(AutoLockTest, TimedWritesAMessageForEachFailedTry) {
  const Records records;
  const FakeSleep sleep;
  FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 50);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  EXPECT_EQ(busy.calls(), 51);
  EXPECT_EQ(sleep.calls(), 50);
  EXPECT_EQ(sleep.microseconds(), 50 * 100'000LL);
  EXPECT_EQ(records.trail(), waiting(50, false, 0));
  EXPECT_FALSE(isHeld());
}

TEST_F(AutoLockTest, TimedAcquiresAMutexThatAnotherThreadHeldForAWhile) {
  const Records records;
  const FakeSleep sleep;
  std::atomic<int> step = 0;
  std::thread holder([&] {
    pthread_mutex_lock(&mutex_);
    step = 1;
    step.notify_all();
    step.wait(1);
    pthread_mutex_unlock(&mutex_);
    step = 3;
    step.notify_all();
  });
  step.wait(0);
  // Right before the library's 21st try the other thread lets go.
  const BeforeCall release(
      Call::pthread_mutex_trylock,
      [&] {
        step = 2;
        step.notify_all();
        step.wait(2);
      },
      21);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  holder.join();
  EXPECT_TRUE(release.fired());
  EXPECT_EQ(records.trail(), waiting(20, false, 0));
  EXPECT_EQ(sleep.calls(), 20);
}

TEST_F(AutoLockTest, TimedMayStillAcquireInTheLastTryOfTheFirstPhase) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 299);
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(records.trail(), waiting(299, false, 0));
  EXPECT_EQ(sleep.calls(), 299);
}

TEST_F(AutoLockTest, TimedSleepsOnAfterASignal) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY);
  const FailingCall interrupted(Call::nanosleep, EINTR, 1, 3);
  { const AutoLock lock(&mutex_, true); }
  EXPECT_EQ(interrupted.calls(), 4);
  EXPECT_EQ(sleep.calls(), 1);
  EXPECT_EQ(records.trail(), waiting(1, false, 0));
}

TEST_F(AutoLockTest, TimedSaysWhenTheSecondPhaseBegins) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 300);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  EXPECT_EQ(records.trail(), waiting(300, true, 0));
  EXPECT_EQ(sleep.microseconds(), 300 * 100'000LL);
}

TEST_F(AutoLockTest, TimedMayStillAcquireInTheVeryLastTry) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 869);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_TRUE(isHeld());
  }
  EXPECT_EQ(records.trail(), waiting(300, true, 569));
  EXPECT_EQ(sleep.calls(), 869);
  EXPECT_FALSE(isHeld());
}

// What the constructor threw, or null.
const char* thrownBy(pthread_mutex_t* mutex) {
  try {
    const AutoLock lock(mutex, true);
  } catch (const char* text) {
    return text;
  }
  return nullptr;
}

TEST_F(AutoLockTest, TimedThrowsAfter870Tries) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 10'000);

  EXPECT_STREQ(thrownBy(&mutex_), kExpired);

  EXPECT_EQ(busy.calls(), 300 + 570);
  EXPECT_EQ(sleep.calls(), 300 + 570);
  EXPECT_EQ(sleep.microseconds(), 300 * 100'000LL + 570 * 1'000'000LL);
  std::vector<std::string> expected = waiting(300, true, 570);
  expected.push_back(std::string("D ") + kExpired + "\n");
  EXPECT_EQ(records.trail(), expected);
}

TEST_F(AutoLockTest, TimedThrowsWithoutMessagesWhileDebugIsOffAndUnlocksNothing) {
  const Records records(kAllEvents & ~kDebug);
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 10'000);
  const FailingCall unlock(Call::pthread_mutex_unlock, EPERM, 1, 10'000);

  EXPECT_STREQ(thrownBy(&mutex_), kExpired);

  EXPECT_EQ(busy.calls(), 870);
  EXPECT_EQ(sleep.calls(), 870);
  EXPECT_EQ(unlock.calls(), 0);
  EXPECT_THAT(records.all(), IsEmpty());
  EXPECT_THAT(records.prints(), IsEmpty());
}

TEST_F(AutoLockTest, TimedTakesAnyOtherErrorForSuccess) {
  for (const int error : {EINVAL, EAGAIN, EPERM, EDEADLK}) {
    SCOPED_TRACE(error);
    const Records records;
    const FakeSleep sleep;
    const FailingCall invalid(Call::pthread_mutex_trylock, error);
    // It unlocks what it does not hold; the real unlock is kept from it here.
    const FailingCall unlock(Call::pthread_mutex_unlock, EPERM);
    {
      const AutoLock lock(&mutex_, true);
      EXPECT_FALSE(isHeld());
      EXPECT_EQ(unlock.calls(), 0);
    }
    EXPECT_EQ(invalid.calls(), 1);
    EXPECT_EQ(unlock.calls(), 1);
    EXPECT_EQ(sleep.calls(), 0);
    EXPECT_THAT(records.trail(), IsEmpty());
  }
}

TEST_F(AutoLockTest, TimedTakesAnErrorAfterFailedTriesForSuccessToo) {
  const Records records;
  const FakeSleep sleep;
  const FailingCall busy(Call::pthread_mutex_trylock, EBUSY, 1, 310);
  const FailingCall invalid(Call::pthread_mutex_trylock, EINVAL, 311);
  {
    const AutoLock lock(&mutex_, true);
    EXPECT_FALSE(isHeld());
    // So that the destructor finds the mutex as its type wants it.
    pthread_mutex_lock(&mutex_);
  }
  EXPECT_EQ(records.trail(), waiting(300, true, 10));
}

TEST_F(LockType, StaysWhileTheConfigurationIsTheSame) {
  setenv("AUTOLOCKTYPE", "REGULARLOCK", 1);
  const FailingCall setting(Call::ldap_getenv, EINVAL, 1000);
  configfile_read = 5;
  for (const int counter : {5, 6, 1000}) {
    al_configfile_counter = counter;
    EXPECT_EQ(AutoLock::ReadAndSetLockType(7), 7);
    EXPECT_EQ(al_configfile_counter, counter);
  }
  EXPECT_EQ(setting.calls(), 0);
}

TEST_F(LockType, FollowsTheSettingAfterAReading) {
  const std::pair<const char*, int> cases[] = {
      {nullptr, 1},       {"REGULARLOCK", 0},  {"", 1},
      {"regularlock", 1}, {"REGULARLOCK ", 1}, {" REGULARLOCK", 1},
      {"REGULARLOC", 1},  {"REGULARLOCK2", 1}, {"TIMEDLOCK", 1},
  };
  for (const auto& [value, type] : cases) {
    SCOPED_TRACE(value == nullptr ? "unset" : value);
    for (const int counter : {4, 0, -3}) {
      if (value == nullptr) {
        unsetenv("AUTOLOCKTYPE");
      } else {
        setenv("AUTOLOCKTYPE", value, 1);
      }
      configfile_read = 5;
      al_configfile_counter = counter;
      EXPECT_EQ(AutoLock::ReadAndSetLockType(7), type);
      EXPECT_EQ(al_configfile_counter, 5);
      EXPECT_EQ(AutoLock::ReadAndSetLockType(7), 7);
    }
  }
  EXPECT_EQ(default_autolock, 0);  // it is the constructor that keeps the answer
}

TEST_F(LockType, LeavesTheCopyOfTheSettingAllocated) {
  REQUIRE_OWN_MALLOC();
  for (const char* const value : {"REGULARLOCK", "anything"}) {
    setenv("AUTOLOCKTYPE", value, 1);
    al_configfile_counter = 0;
    const LiveAllocations live;
    AutoLock::ReadAndSetLockType(1);
    EXPECT_EQ(live.blocks(), 1) << value;
  }
  unsetenv("AUTOLOCKTYPE");
  al_configfile_counter = 0;
  const LiveAllocations live;
  AutoLock::ReadAndSetLockType(1);
  EXPECT_EQ(live.blocks(), 0);
}

// ---- AutoFree ----

int released_count = 0;
void* released_last = nullptr;
void countRelease(void* memory) {
  ++released_count;
  released_last = memory;
}

class Buffer : public testing::Test {
 protected:
  Buffer() {
    released_count = 0;
    released_last = nullptr;
  }

  char buffer_[4] = "abc";
};

using AutoFreeTest = Buffer;

TEST_F(AutoFreeTest, ReleasesItsPointerOnceAtItsEnd) {
  {
    const AutoFree<char> owner(buffer_, countRelease);
    EXPECT_EQ(owner.get(), buffer_);
    EXPECT_EQ(owner.get(), buffer_);
    EXPECT_EQ(released_count, 0);
  }
  EXPECT_EQ(released_count, 1);
  EXPECT_EQ(released_last, buffer_);
}

TEST_F(AutoFreeTest, OfANullPointerReleasesNothing) {
  { EXPECT_EQ(AutoFree<char>(nullptr, countRelease).get(), nullptr); }
  EXPECT_EQ(released_count, 0);
  { EXPECT_EQ(AutoFree<char>(nullptr, nullptr).get(), nullptr); }
}

TEST_F(AutoFreeTest, ReadsItsPointerUnderAMutexOfItsOwn) {
  const AutoFree<char> owner(buffer_, countRelease);
  const FailingCall lock(Call::pthread_mutex_lock, EINVAL, 1000);
  const FailingCall trylock(Call::pthread_mutex_trylock, EBUSY, 1000);
  const FailingCall unlock(Call::pthread_mutex_unlock, EPERM, 1000);
  owner.get();
  EXPECT_EQ(lock.calls(), 1);
  EXPECT_EQ(trylock.calls(), 0);
  EXPECT_EQ(unlock.calls(), 1);
}

TEST_F(AutoFreeTest, TakesNoLockAtItsEnd) {
  const FailingCall lock(Call::pthread_mutex_lock, EINVAL, 1000);
  { const AutoFree<char> owner(buffer_, countRelease); }
  EXPECT_EQ(lock.calls(), 0);
  EXPECT_EQ(released_count, 1);
}

// ---- what programs compiled against the classes rely on ----

using Destructor = void (*)(void*);

// The entries behind the object's vtable pointer; fails unless they are just two.
const Destructor* slotsOf(const void* object, const char* table_name) {
  const Destructor* slots = nullptr;
  memcpy(&slots, object, sizeof slots);
  Dl_info info = {};
  void* found = nullptr;
  EXPECT_NE(dladdr1(static_cast<const void*>(slots), &info, &found, RTLD_DL_SYMENT), 0);
  EXPECT_STREQ(info.dli_sname, table_name);
  const auto* const symbol = static_cast<const ElfW(Sym)*>(found);
  EXPECT_EQ(symbol == nullptr ? 0 : symbol->st_size, 4 * sizeof(void*));  // two words, two slots
  return slots;
}

TEST_F(AutoLockTest, IsATableOfTwoDestructorsAndTheMutex) {
  static_assert(sizeof(AutoLock) == 2 * sizeof(void*));
  void* const place = ::operator new(sizeof(AutoLock));
  auto* const lock = new (place) AutoLock(&mutex_, false);
  EXPECT_EQ(words<2>(*lock)[1], word(&mutex_));
  const Destructor* const slots = slotsOf(lock, "_ZTV8AutoLock");

  slots[0](lock);  // destroys only
  EXPECT_FALSE(isHeld());
  new (place) AutoLock(&mutex_, false);
  slots[1](place);  // gives the memory back too, which the leak checker confirms
  EXPECT_FALSE(isHeld());
}

TEST_F(AutoFreeTest, IsATableOfTwoDestructorsThePointerTheReleaseAndTheMutex) {
  constexpr size_t kWords = 3 + sizeof(pthread_mutex_t) / sizeof(void*);
  void* const place = ::operator new(sizeof(AutoFree<char>));
  auto* const owner = new (place) AutoFree<char>(buffer_, countRelease);
  const auto fields = words<kWords>(*owner);
  EXPECT_EQ(fields[1], word(buffer_));
  EXPECT_EQ(fields[2], reinterpret_cast<uintptr_t>(&countRelease));
  const pthread_mutex_t fresh = PTHREAD_MUTEX_INITIALIZER;
  EXPECT_EQ(memcmp(reinterpret_cast<char*>(owner) + 3 * sizeof(void*), &fresh, sizeof fresh), 0);
  const Destructor* const slots = slotsOf(owner, "_ZTV8AutoFreeIcE");

  slots[0](owner);
  EXPECT_EQ(released_count, 1);
  new (place) AutoFree<char>(buffer_, countRelease);
  slots[1](place);
  EXPECT_EQ(released_count, 2);
}

TEST_F(AutoLockTest, IsDestroyedThroughItsBase) {
  struct Derived : AutoLock {
    Derived(pthread_mutex_t* mutex, bool* gone) : AutoLock(mutex, false), gone_(gone) {}
    ~Derived() override { *gone_ = true; }
    bool* gone_;
  };
  bool gone = false;
  AutoLock* const base = new Derived(&mutex_, &gone);
  EXPECT_TRUE(isHeld());
  delete base;
  EXPECT_TRUE(gone);
  EXPECT_FALSE(isHeld());
}

// ---- threads ----

constexpr int kThreads = 8;

void onAllThreads(const std::function<void(int)>& body) {
  std::vector<std::thread> threads;
  for (int number = 0; number < kThreads; ++number) threads.emplace_back(body, number);
  for (std::thread& thread : threads) thread.join();
}

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

  int next[kThreads] = {};  // each thread's messages: every number twice
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

TEST_F(AutoLockTest, ExcludesOtherThreads) {
  int counter = 0;
  onAllThreads([&](int) {
    for (int turn = 0; turn < 500; ++turn) {
      const AutoLock lock(&mutex_, false);
      ++counter;
    }
  });
  EXPECT_EQ(counter, kThreads * 500);
}

TEST_F(AutoLockTest, TimedOnesDecideTheLockTypeTogether) {
  onAllThreads([](int thread) {
    pthread_mutex_t own = PTHREAD_MUTEX_INITIALIZER;
    for (int turn = 0; turn < 200; ++turn) {
      if (thread == 0) __atomic_add_fetch(&configfile_read, 1, __ATOMIC_RELAXED);
      const AutoLock lock(&own, true);
    }
  });
  EXPECT_EQ(default_autolock, 1);
}

}  // namespace
