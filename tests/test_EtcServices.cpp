#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <string.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <thread>
#include <type_traits>
#include <vector>

#include "cancelled.h"
#include "faults.h"
#include "osutils.h"
#include "power_failure.h"
#include "records.h"
#include "small_stack.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;
using VRAOSUtils::EtcServices;
using VRAOSUtils::ServicesEntry;

namespace {

// ---- What is compared ----

struct Service {
  std::string name;
  int port;
  bool operator==(const Service&) const = default;
};

void PrintTo(const Service& service, std::ostream* out) {
  *out << "\"" << service.name << "\" " << service.port;
}

// The field at this offset of the object; what it is has a test of its own below.
template <typename Field>
Field fieldAt(const EtcServices& services, size_t offset) {
  Field field;
  memcpy(&field, reinterpret_cast<const char*>(&services) + offset, sizeof field);
  return field;
}

std::vector<Service> listOf(const EtcServices& services) {
  std::vector<Service> list;
  for (const auto* entry = fieldAt<const ServicesEntry*>(services, 16); entry != nullptr;
       entry = entry->next) {
    list.push_back({entry->name, entry->port});
  }
  return list;
}

Trail member(const std::string& name, int code, const Trail& inside = {}) {
  return call("EtcServices::" + name, code, inside);
}

const Trail kFreed = member("freeServicesEntries", 0);
const Trail kListed = member("doesServiceExist", 1, member("getServicesEntry", 0));
const Trail kNotListed = member("doesServiceExist", 0, member("getServicesEntry", 0));

// ---- Where it happens ----

// Points the class at files of the test's own, and back again.
class EtcServicesTest : public testing::Test {
 protected:
  EtcServicesTest() : mask_(umask(022)) { pointAt(path, backup); }
  ~EtcServicesTest() override {
    EtcServices::ETC_SERVICES_FILE = original_;
    EtcServices::ETC_SERVICES_FILE_BACKUP = original_backup_;
    umask(mask_);
  }

  static void pointAt(const std::string& services, const std::string& copy) {
    EtcServices::ETC_SERVICES_FILE = services.c_str();
    EtcServices::ETC_SERVICES_FILE_BACKUP = copy.c_str();
  }

  // What is loaded from a file with these contents.
  std::vector<Service> loaded(const std::string& contents) const {
    unlink(path.c_str());  // some file systems wait for the disk when a file is written over
    writeFile(path, contents);
    EtcServices services;
    EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
    return listOf(services);
  }

  // What a file with these contents holds after the deletion.
  std::string without(const std::string& name, const std::string& contents) const {
    unlink(path.c_str());
    writeFile(path, contents);
    EtcServices services;
    EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
    EXPECT_EQ(services.deleteService(name.c_str()), OSUTILS_SUCCESS) << name;
    EXPECT_FALSE(pathExists(backup));
    return contentsOf(path);
  }

  const TempDir temp;
  std::string path = temp.path("services");
  std::string backup = temp.path("services.save");

 private:
  const char* const original_ = EtcServices::ETC_SERVICES_FILE;
  const char* const original_backup_ = EtcServices::ETC_SERVICES_FILE_BACKUP;
  const mode_t mask_;
};

// ---- Constants and layout ----

TEST(EtcServicesClass, HasItsPublishedConstants) {
  static_assert(std::is_same_v<decltype(EtcServices::ETC_SERVICES_FILE), const char*>);
  static_assert(std::is_same_v<decltype(EtcServices::ETC_SERVICES_FILE_BACKUP), const char*>);
  static_assert(std::is_same_v<decltype(EtcServices::ETC_SERVICE_MIN_PORT), const int>);
  EXPECT_STREQ(EtcServices::ETC_SERVICES_FILE, "/etc/services");
  EXPECT_STREQ(EtcServices::ETC_SERVICES_FILE_BACKUP, "/etc/services.vrasave");

  // Through their addresses: the library must hold them, not the header alone.
  const int* const constants[] = {&EtcServices::ETC_SERVICE_MIN_PORT,
                                  &EtcServices::ETC_SERVICE_MAX_PORT, &EtcServices::INIT_PORT_INDEX,
                                  &EtcServices::INIT_PORT_INDEX_INTERRUPT};
  EXPECT_THAT(std::vector<int>({*constants[0], *constants[1], *constants[2], *constants[3]}),
              ElementsAre(1, 400000, 3700, 3701));
}

TEST(EtcServicesClass, KeepsTheLayoutThatClientsWereCompiledWith) {
  static_assert(sizeof(ServicesEntry::name) == 91);
  static_assert(offsetof(ServicesEntry, name) == 0);
  static_assert(offsetof(ServicesEntry, port) == 92);
  static_assert(offsetof(ServicesEntry, next) == 96);
  static_assert(sizeof(ServicesEntry) == 104);
  static_assert(std::is_polymorphic_v<EtcServices>);
  static_assert(std::has_virtual_destructor_v<EtcServices>);
  static_assert(!std::is_copy_constructible_v<EtcServices>);
  static_assert(sizeof(EtcServices) == 24);

  const EtcServices services;
  EXPECT_STREQ(fieldAt<const char*>(services, 8), "/etc/services");
  EXPECT_NE(fieldAt<const char*>(services, 8), EtcServices::ETC_SERVICES_FILE) << "a copy";
  EXPECT_EQ(fieldAt<const ServicesEntry*>(services, 16), nullptr);
}

TEST_F(EtcServicesTest, FieldsArePathAndList) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();

  EXPECT_EQ(fieldAt<const char*>(services, 8), path);
  EXPECT_EQ(fieldAt<const ServicesEntry*>(services, 16), services.getServicesEntry("alpha"));
}

TEST_F(EtcServicesTest, EveryMemberFunctionHasItsOwnIdAndClass) {
  writeFile(path, "alpha 1/tcp\n");
  Records records(kEntryExit33 | kEntryExit43);
  const auto idsOf = [&](const auto& action) {
    records.clear();
    action();
    std::vector<uint64_t> ids;
    for (const Record& record : records.all()) {
      const uint64_t trace_class = (record.id >> 8 & 0xFF) >= 10 ? 43 : 33;
      if ((record.id >> 16) != 0x3E01) continue;  // of another family
      EXPECT_EQ(record.type, 0x3000000 | ((trace_class - (record.hasData ? 0 : 1)) << 16));
      if (!record.hasData) ids.push_back(record.id);
    }
    return ids;
  };

  std::optional<EtcServices> services;
  EXPECT_THAT(idsOf([&] { services.emplace(); }), ElementsAre(0x3E010100));
  EXPECT_THAT(idsOf([&] { services->readEtcServices(); }), ElementsAre(0x3E010300, 0x3E010B00));
  EXPECT_THAT(idsOf([&] { services->addService(nullptr, 1); }), ElementsAre(0x3E010400));
  EXPECT_THAT(idsOf([&] { services->deleteService(nullptr); }), ElementsAre(0x3E010500));
  EXPECT_THAT(idsOf([&] { services->doesServiceExist("a"); }), ElementsAre(0x3E010600, 0x3E010A00));
  EXPECT_THAT(idsOf([&] { services->getServicePort("a"); }), ElementsAre(0x3E010700, 0x3E010A00));
  EXPECT_THAT(idsOf([&] { services->isPortAvaliable(1); }), ElementsAre(0x3E010800));
  EXPECT_THAT(idsOf([&] { services->findAvaliablePort(2); }), ElementsAre(0x3E010900, 0x3E010800));
  EXPECT_THAT(idsOf([&] { services.reset(); }), ElementsAre(0x3E010200, 0x3E010B00));
}

TEST_F(EtcServicesTest, SearchAndFreeHaveAMaskBitOfTheirOwn) {
  writeFile(path, "alpha 1/tcp\n");
  const Records records(kEntryExit43 | kExitError43);
  EtcServices services;
  services.readEtcServices();
  EXPECT_EQ(services.getServicePort("alpha"), 1);

  EXPECT_THAT(records.trail(), ElementsAreArray(kFreed + member("getServicesEntry", 0)));
}

// ---- Construction and destruction ----

TEST_F(EtcServicesTest, ConstructorReadsNoFile) {
  const FailingCall opens(Call::fopen64, 0, kNever);
  const FailingCall queries(Call::stat64, 0, kNever);
  const Records records;

  const EtcServices services;

  EXPECT_THAT(listOf(services), IsEmpty());
  EXPECT_EQ(opens.calls() + queries.calls(), 0);
  EXPECT_THAT(records.trail(), ElementsAreArray(member("EtcServices", 0)));
}

TEST_F(EtcServicesTest, PathIsTheOneThatWasSetAtConstruction) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  const std::string other = temp.file("other", "beta 2/tcp\n");
  EtcServices::ETC_SERVICES_FILE = other.c_str();

  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}));
}

TEST_F(EtcServicesTest, DestructorFreesThePathAndTheList) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\n");
  const LiveAllocations memory;
  {
    EtcServices services;
    EXPECT_EQ(memory.blocks(), 1);
    services.readEtcServices();
    services.addService("gamma", 3);
    EXPECT_EQ(memory.blocks(), 4);
  }
  EXPECT_EQ(memory.blocks(), 0);
}

TEST_F(EtcServicesTest, DestructorLeavesRecords) {
  std::optional<EtcServices> services(std::in_place);
  const Records records;

  services.reset();

  EXPECT_THAT(records.trail(), ElementsAreArray(member("~EtcServices", 0, kFreed)));
}

TEST_F(EtcServicesTest, WithoutItsPathEveryFileOperationIsAParameterError) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, "alpha 1/tcp\n");
  FailingCall copy(Call::strdup, ENOMEM);
  EtcServices services;
  ASSERT_TRUE(copy.fired());
  const Trail refused =
      call("checkFilePerms", 89, Trail{"D checkFilePerms: passed a null pointer.\n"});

  {
    const Records records;
    EXPECT_EQ(services.readEtcServices(), OSUTILS_PARAM_ERROR);
    EXPECT_THAT(records.trail(), ElementsAreArray(member("readEtcServices", 89, kFreed + refused)));
  }
  {
    const Records records;
    EXPECT_EQ(services.addService("beta", 2), OSUTILS_PARAM_ERROR);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(
                    member("addService", 89, kNotListed + member("isPortAvaliable", 1) + refused)));
  }
  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_NO_SUCH_OBJECT) << "the list is empty";
  EXPECT_THAT(listOf(services), IsEmpty());
  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\n");
}

// ---- Questions ----

TEST_F(EtcServicesTest, WithoutLoadingEveryNameIsAbsentAndEveryPortFree) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;

  EXPECT_FALSE(services.doesServiceExist("alpha"));
  EXPECT_EQ(services.getServicePort("alpha"), -1);
  EXPECT_EQ(services.getServicesEntry("alpha"), nullptr);
  EXPECT_TRUE(services.isPortAvaliable(1));
  EXPECT_EQ(services.findAvaliablePort(0), 1);
  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_NO_SUCH_OBJECT);
}

TEST_F(EtcServicesTest, QuestionsAboutANullNameSayWhichFunctionWasAsked) {
  EtcServices services;
  const auto null_message = [](const std::string& name) {
    return Trail{"D EtcServices: " + name + ": passed a null pointer.\n"};
  };
  Records records;

  EXPECT_EQ(services.getServicesEntry(nullptr), nullptr);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("getServicesEntry", 0, null_message("getServicesEntry"))));
  records.clear();
  EXPECT_FALSE(services.doesServiceExist(nullptr));
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("doesServiceExist", 0, null_message("doesServiceExist"))));
  records.clear();
  EXPECT_EQ(services.getServicePort(nullptr), -1);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("getServicePort", 0, null_message("getServicePort"))));
  records.clear();
  EXPECT_EQ(services.addService(nullptr, 1), OSUTILS_PARAM_ERROR);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("addService", 89, null_message("addService"))));
  records.clear();
  EXPECT_EQ(services.deleteService(nullptr), OSUTILS_PARAM_ERROR);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("deleteService", 89, null_message("deleteService"))));
}

TEST_F(EtcServicesTest, NamesAreComparedExactly) {
  writeFile(path, "Alpha 1/tcp\nalphabet 2/tcp\n");
  EtcServices services;
  services.readEtcServices();

  EXPECT_TRUE(services.doesServiceExist("Alpha"));
  for (const char* const other : {"alpha", "ALPHA", "Alph", "Alpha ", "", "alphabe"}) {
    EXPECT_FALSE(services.doesServiceExist(other)) << other;
    EXPECT_EQ(services.getServicePort(other), -1) << other;
  }
}

TEST_F(EtcServicesTest, FirstRecordOfANameAnswers) {
  writeFile(path, "alpha 1/tcp\nalpha 2/udp\n");
  EtcServices services;
  services.readEtcServices();
  const Records records;

  EXPECT_EQ(services.getServicePort("alpha"), 1);

  // The port is no result code: nothing is stored for the exit record.
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("getServicePort", 0, member("getServicesEntry", 0))));
  EXPECT_EQ(services.getServicesEntry("alpha"), fieldAt<ServicesEntry*>(services, 16));
}

TEST_F(EtcServicesTest, PortsAreFreeFrom1To400000UnlessListed) {
  writeFile(path, "alpha 3700/udp\nfar 500000/tcp\nnone 0/tcp\n");
  EtcServices services;
  services.readEtcServices();

  for (const int port : {1, 3699, 3701, 65535, 65536, 400000}) {
    EXPECT_TRUE(services.isPortAvaliable(port)) << port;
  }
  for (const int port : {3700, 0, -1, 400001, 500000, INT_MAX, INT_MIN, INT_MIN + 1}) {
    EXPECT_FALSE(services.isPortAvaliable(port)) << port;
  }
}

TEST_F(EtcServicesTest, PortQuestionsRecordTheirAnswers) {
  writeFile(path, "alpha 3700/udp\nlast 400000/tcp\n");
  EtcServices services;
  services.readEtcServices();
  Records records;

  EXPECT_EQ(services.findAvaliablePort(3700), 3701);
  EXPECT_THAT(records.trail(), ElementsAreArray(member(
                                   "findAvaliablePort", 3701,
                                   member("isPortAvaliable", 0) + member("isPortAvaliable", 1))));
  records.clear();
  EXPECT_EQ(services.findAvaliablePort(400000), -1);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("findAvaliablePort", -1, member("isPortAvaliable", 0))));
}

TEST_F(EtcServicesTest, SearchForAPortBeginsAtTheStartAndNeverWraps) {
  writeFile(path, "one 1/tcp\ntwo 2/udp\n");
  EtcServices services;
  services.readEtcServices();

  for (const int start : {0, -1, INT_MIN, 1, 2, 3}) {
    EXPECT_EQ(services.findAvaliablePort(start), 3) << start;
  }
  EXPECT_EQ(services.findAvaliablePort(3700), 3700);
  EXPECT_EQ(services.findAvaliablePort(400000), 400000);
  EXPECT_EQ(services.findAvaliablePort(400001), -1);
  EXPECT_EQ(services.findAvaliablePort(INT_MAX), -1);
}

// A file that has these ports, and some lines with numbers that are none.
std::string linesWithPorts(const std::vector<int>& ports) {
  std::string lines = "none 0/tcp\nlarge 400001/tcp\nlarger 4000000000/tcp\n";
  for (const int port : ports)
    lines += "s" + std::to_string(port) + " " + std::to_string(port) + "/tcp\n";
  return lines;
}

// With its records, it asks for each port.
TEST_F(EtcServicesTest, SearchForAPortFindsTheSameWhetherItIsTracedOrNot) {
  std::minstd_rand next(1);
  std::vector<int> ports;
  for (int port = 16000; port < 17000; ++port)
    ports.push_back(port);  // longer than what is looked at at once
  for (int port = 30000; port < 50100; ++port) {
    if (port % 1000 != 7) ports.push_back(port);
  }
  for (int i = 0; i < 300; ++i) ports.push_back(1 + static_cast<int>(next() % 400));
  for (int port = 399900; port <= 400000; ++port) {
    if (port % 10 != 3) ports.push_back(port);
  }
  writeFile(path, linesWithPorts(ports));
  EtcServices services;
  ASSERT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
  std::vector<int> starts = {INT_MIN, -1,     0,      1,      2,      200,    16384,
                             16385,   16000,  32768,  33000,  33008,  49999,  50099,
                             50100,   399900, 399994, 400000, 400001, INT_MAX};
  for (int i = 0; i < 100; ++i) starts.push_back(1 + static_cast<int>(next() % 400000));

  for (const int start : starts) {
    SCOPED_TRACE(start);
    const std::set<int> taken(ports.begin(), ports.end());
    int expected = std::max(start, 1);
    while (expected <= 400000 && taken.count(expected) != 0) ++expected;
    if (expected > 400000) expected = -1;
    EXPECT_EQ(services.findAvaliablePort(start), expected);
    for (const uint64_t events : {kAllEvents, kEntryExit33, kExitError33, kDebug, kEntryExit43}) {
      const Records records(events);
      EXPECT_EQ(services.findAvaliablePort(start), expected);
      const size_t questions =
          start > 400000
              ? 0
              : static_cast<size_t>((expected == -1 ? 400001 : expected + 1) - std::max(start, 1));
      if (events == kEntryExit33) {
        EXPECT_EQ(records.all().size(), 2 * (questions + 1));
      } else if (events == kExitError33) {
        EXPECT_EQ(records.all().size(), questions + 1);
      }
    }
  }
}

// One pass over the list for each port would take hours.
TEST_F(EtcServicesTest, SearchForAPortEndsWhenAllAreTaken) {
  std::vector<int> ports;
  for (int port = 400000; port > 0; --port) ports.push_back(port);
  writeFile(path, linesWithPorts(ports));
  EtcServices services;
  ASSERT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);

  EXPECT_EQ(services.findAvaliablePort(1), -1);
}

TEST_F(EtcServicesTest, FreeingEmptiesTheListAndMayBeRepeated) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\n");
  EtcServices services;
  services.readEtcServices();

  services.freeServicesEntries();
  EXPECT_THAT(listOf(services), IsEmpty());
  EXPECT_FALSE(services.doesServiceExist("alpha"));
  services.freeServicesEntries();
  EXPECT_THAT(listOf(services), IsEmpty());
}

// ---- Loading ----

TEST_F(EtcServicesTest, LoadsOneRecordForEachServiceLineInTheOrderOfTheFile) {
  EXPECT_THAT(loaded("# a comment 1/tcp\n"
                     "\n"
                     "zeta\t7/tcp\n"
                     " \t beta 3700/udp alias # comment\n"
                     "zeta 7/udp\n"
                     "9digit 1/tcp\n"
                     "+sign 1/tcp\n"
                     "-sign 1/tcp\n"
                     "_low 1/tcp\n"
                     "no-port\n"
                     "word x1/tcp\n"
                     "sign +1/tcp\n"
                     "negative -1/tcp\n"
                     "bare 5\n"
                     "slash/6 6/tcp\n"
                     "\v\f\ralpha\v8/tcp\n"),
              ElementsAre(Service{"zeta", 7}, Service{"beta", 3700}, Service{"zeta", 7},
                          Service{"bare", 5}, Service{"slash/6", 6}, Service{"alpha", 8}));
}

TEST_F(EtcServicesTest, LoadsWithTheRecordsOfEachStep) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  const Records records;

  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);

  EXPECT_THAT(records.trail(), ElementsAreArray(member("readEtcServices", 0, kFreed + kGoodFile)));
}

TEST_F(EtcServicesTest, LoadingAgainReplacesTheList) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  writeFile(path, "beta 2/tcp\n");

  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);

  EXPECT_THAT(listOf(services), ElementsAre(Service{"beta", 2}));
}

TEST_F(EtcServicesTest, LoadsTheLastLineOnceWithOrWithoutItsNewline) {
  EXPECT_THAT(loaded("alpha 1/tcp\nbeta 2/tcp"),
              ElementsAre(Service{"alpha", 1}, Service{"beta", 2}));
  EXPECT_THAT(loaded("alpha 1/tcp\n"), ElementsAre(Service{"alpha", 1}));
  EXPECT_THAT(loaded("alpha 1"), ElementsAre(Service{"alpha", 1}));
  EXPECT_THAT(loaded("alpha 1/tcp\r\nbeta 2/tcp\r\n"),
              ElementsAre(Service{"alpha", 1}, Service{"beta", 2}));
  EXPECT_THAT(loaded(""), IsEmpty());
  EXPECT_THAT(loaded("\n\n"), IsEmpty());
}

TEST_F(EtcServicesTest, LineEndsAtAnEmbeddedNul) {
  using namespace std::string_literals;
  EXPECT_THAT(loaded("alpha\0 1/tcp\nbeta 2\0003/tcp\n\0gamma 4/tcp\ndelta 5/tcp\n"s),
              ElementsAre(Service{"beta", 2}, Service{"delta", 5}));
}

TEST_F(EtcServicesTest, PortIsWhatTheDecimalConversionMakesOfIt) {
  EXPECT_THAT(
      loaded("a 0/tcp\nb 007/tcp\nc 400001/tcp\nd 2147483647/tcp\ne 80abc\n"
             "f 4294967297/tcp\ng 99999999999999999999999999/tcp\n"),
      ElementsAre(Service{"a", 0}, Service{"b", 7}, Service{"c", 400001}, Service{"d", 2147483647},
                  Service{"e", 80}, Service{"f", 1}, Service{"g", -1}));
}

TEST_F(EtcServicesTest, LongNamesAreCutTo90Characters) {
  for (const size_t length : {size_t{89}, size_t{90}, size_t{91}, size_t{95}, size_t{1000}}) {
    SCOPED_TRACE(length);
    EXPECT_THAT(loaded(std::string(length, 'n') + " 7/tcp\nnext 8/tcp\n"),
                ElementsAre(Service{std::string(std::min(length, size_t{90}), 'n'), 7},
                            Service{"next", 8}));
  }
}

TEST_F(EtcServicesTest, LongLinesComeInPiecesOf1023Characters) {
  // The word behind the blanks is cut at the border, or begins behind it.
  const struct {
    size_t blanks;
    const char* name;
  } cases[] = {{1019, "a"},     {1020, "ha"},    {1021, "pha"},  {1022, "lpha"},
               {1023, "alpha"}, {1024, "alpha"}, {1025, "alpha"}};
  for (const auto& [blanks, name] : cases) {
    SCOPED_TRACE(blanks);
    EXPECT_THAT(loaded(std::string(blanks, ' ') + "alpha 7/tcp\nbeta 8/tcp\n"),
                ElementsAre(Service{name, 7}, Service{"beta", 8}));
  }
  // A first piece with a name but no port, and a second one with a port but no name.
  EXPECT_THAT(loaded(std::string(1018, ' ') + "alpha 7/tcp\nbeta 8/tcp\n"),
              ElementsAre(Service{"beta", 8}));
}

TEST_F(EtcServicesTest, LongLinesComeInTheSamePiecesWhereverABlockOfTheFileEnds) {
  for (const size_t block_bytes : {2048U, 4096U, 16384U}) {
    for (size_t in_first_block = 1015; in_first_block <= 1030; ++in_first_block) {
      SCOPED_TRACE(std::to_string(block_bytes) + " " + std::to_string(in_first_block));
      EXPECT_THAT(loaded(std::string(block_bytes - in_first_block, '\n') + std::string(1021, ' ') +
                         "alpha 7/tcp\nbeta 8/tcp\n"),
                  ElementsAre(Service{"pha", 7}, Service{"beta", 8}));
    }
  }
}

TEST_F(EtcServicesTest, KeepsToASmallStack) {
  REQUIRE_OWN_MALLOC();  // and the frames
  std::string lines = "alpha 1/tcp\n";
  while (lines.size() < 40000) lines += "beta 2/tcp # one of very many\n";
  // Once on a large stack, where the loader looks up what is called.
  for (const bool small : {false, true}) {
    writeFile(path, lines);
    writeFile(backup, "an old one, so that no account has to be looked up");
    bool done = false;
    const auto edit = [&] {
      EtcServices file;
      done = file.readEtcServices() == OSUTILS_SUCCESS &&
             file.deleteService("alpha") == OSUTILS_SUCCESS;
    };
    if (small) {
      EXPECT_TRUE(keepsToASmallStack(edit));
    } else {
      edit();
    }
    EXPECT_TRUE(done);
    EXPECT_TRUE(contentsOf(path) == lines.substr(sizeof "alpha 1/tcp\n" - 1));
  }
}

TEST_F(EtcServicesTest, LinesOf1022To1025CharactersGiveOneRecord) {
  for (const size_t length : {1022U, 1023U, 1024U, 1025U}) {
    SCOPED_TRACE(length);
    std::string line = "alpha 7/tcp #";
    line += std::string(length - line.size() - 1, 'x') + "\n";
    EXPECT_THAT(loaded(line + "beta 8/tcp\n"),
                ElementsAre(Service{"alpha", 7}, Service{"beta", 8}));
    EXPECT_THAT(loaded(line.substr(0, length - 1)), ElementsAre(Service{"alpha", 7}));
  }
}

TEST_F(EtcServicesTest, LineOfAMillionCharactersGivesOneRecordForEachPieceThatLooksLikeOne) {
  std::string line = "alpha 7/tcp " + std::string(1000000, 'x');
  line.replace(500 * 1023, 10, "inside 9/u");
  EXPECT_THAT(loaded(line + "\nbeta 8/tcp\n"),
              ElementsAre(Service{"alpha", 7}, Service{"inside", 9}, Service{"beta", 8}));
}

TEST_F(EtcServicesTest, LoadsAMillionLinesInOrder) {
  constexpr int kLines = 1000000;
  std::string contents;
  for (int i = 0; i < kLines; ++i) {
    contents += "s" + std::to_string(i) + "\t" + std::to_string(i % 400000 + 1) + "/tcp\n";
  }

  const std::vector<Service> list = loaded(contents);

  ASSERT_EQ(list.size(), static_cast<size_t>(kLines));
  for (int i = 0; i < kLines; ++i) {
    const Service& service = list[static_cast<size_t>(i)];
    ASSERT_EQ(service.name, "s" + std::to_string(i));
    ASSERT_EQ(service.port, i % 400000 + 1);
  }
}

TEST_F(EtcServicesTest, LoadsThroughALinkAndNothingThroughADanglingOne) {
  const std::string target = temp.file("target", "alpha 1/tcp\n");
  ASSERT_EQ(symlink(target.c_str(), path.c_str()), 0);
  EtcServices services;
  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}));

  ASSERT_EQ(unlink(target.c_str()), 0);
  EXPECT_EQ(services.readEtcServices(), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_THAT(listOf(services), IsEmpty());
  EXPECT_EQ(services.addService("beta", 2), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_FALSE(pathExists(target));
}

TEST_F(EtcServicesTest, WaitsAtAPipeAndLoadsWhatAWriterSends) {
  ASSERT_EQ(mkfifo(path.c_str(), 0600), 0);
  EtcServices services;
  // Nobody writes until the library opens the pipe.
  std::thread writer;
  const BeforeCall open(Call::fopen64, [&] {
    writer = std::thread([&] {
      std::ofstream pipe(path);
      pipe << "alpha 1/tcp\nbe" << std::flush << "ta 2/tcp\n" << std::string(20000, '#');
      pipe << "\ngamma 3/tcp";
    });
  });

  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);

  ASSERT_TRUE(open.fired());
  writer.join();
  EXPECT_THAT(listOf(services),
              ElementsAre(Service{"alpha", 1}, Service{"beta", 2}, Service{"gamma", 3}));
}

TEST_F(EtcServicesTest, LoadingFromAMissingFileEmptiesTheList) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  ASSERT_EQ(unlink(path.c_str()), 0);
  const Records records;

  EXPECT_EQ(services.readEtcServices(), OSUTILS_NO_SUCH_OBJECT);

  EXPECT_THAT(listOf(services), IsEmpty());
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member(
          "readEtcServices", 32,
          kFreed + call("checkFilePerms", 32,
                        missing("doesFileExist", 0) + missing("canAccessFile", 1) +
                            Trail{"D checkFilePerms - The file " + path + " does not exist.\n"}))));
}

TEST_F(EtcServicesTest, DirectoryIsNoServicesFile) {
  ASSERT_EQ(mkdir(path.c_str(), 0755), 0);
  EtcServices services;

  EXPECT_EQ(services.readEtcServices(), OSUTILS_CONSTRAINT_VIOLATION);
  EXPECT_EQ(services.addService("alpha", 1), OSUTILS_CONSTRAINT_VIOLATION);

  EXPECT_THAT(listOf(services), IsEmpty());
  EXPECT_TRUE(std::filesystem::is_directory(path));
}

TEST_F(EtcServicesTest, FileThatCannotBeOpenedForReading) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  const int descriptors = openDescriptors();
  const Records records;
  const FailingCall open(Call::fopen64, EMFILE);

  EXPECT_EQ(services.readEtcServices(), OSUTILS_UNWILLING_TO_PERFORM);

  ASSERT_TRUE(open.fired());
  EXPECT_THAT(listOf(services), IsEmpty());
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member("readEtcServices", 53,
                              kFreed + kGoodFile + Trail{"D EtcServices: fopen: errno =24\n"})));
}

TEST_F(EtcServicesTest, PermissionsAreThoseOfTheUser) {
  REQUIRE_ROOT("to become another user");
  writeFile(path, "alpha 1/tcp\n");
  ASSERT_EQ(chmod(path.c_str(), 0600), 0);
  const std::string closed = temp.dir("closed");
  const std::string hidden = temp.file("closed/services", "alpha 1/tcp\n");
  ASSERT_EQ(chmod(closed.c_str(), 0700), 0);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EtcServices unreadable;
                     const Records records;
                     EXPECT_EQ(unreadable.readEtcServices(), OSUTILS_UNWILLING_TO_PERFORM);
                     EXPECT_THAT(records.texts(), ElementsAre("EtcServices: fopen: errno =13\n"));
                     EXPECT_EQ(unreadable.addService("beta", 2), OSUTILS_INSUFFICIENT_ACCESS);

                     pointAt(hidden, backup);
                     EtcServices invisible;
                     EXPECT_EQ(invisible.readEtcServices(), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_EQ(invisible.addService("beta", 2), OSUTILS_INSUFFICIENT_ACCESS);
                     return 0;
                   }),
            0);
  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\n");
  EXPECT_EQ(contentsOf(hidden), "alpha 1/tcp\n");
}

TEST_F(EtcServicesTest, LoadingIsAllOrNothingWhenMemoryRunsOut) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, "alpha 1/tcp\nno-port\nbeta 2/tcp\ngamma 3/tcp\n");
  EtcServices services;
  const int descriptors = openDescriptors();
  int nth = 1;
  for (;; ++nth) {
    SCOPED_TRACE(nth);
    services.freeServicesEntries();
    const LiveAllocations memory;
    FailingCall allocation(Call::allocation, ENOMEM, nth);
    const int rc = services.readEtcServices();
    allocation.disarm();
    EXPECT_EQ(openDescriptors(), descriptors);
    if (!allocation.fired()) {
      EXPECT_EQ(rc, OSUTILS_SUCCESS);
      EXPECT_EQ(memory.blocks(), 3) << "the line without a port leaves no record behind";
      break;
    }
    EXPECT_EQ(rc, OSUTILS_NO_MEMORY);
    EXPECT_THAT(listOf(services), IsEmpty());
    EXPECT_EQ(memory.blocks(), 0);
  }
  EXPECT_EQ(nth, 5) << "one record for each line that begins with a letter";
}

TEST_F(EtcServicesTest, FreesTheListBeforeItReportsThatMemoryRanOut) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\n");
  EtcServices services;
  const Records records;
  const FailingCall allocation(Call::malloc, ENOMEM, 2);

  EXPECT_EQ(services.readEtcServices(), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(allocation.fired());
  EXPECT_THAT(
      records.trail(),
      ElementsAreArray(member("readEtcServices", 90,
                              kFreed + kGoodFile + kFreed +
                                  Trail{"D EtcServices: readEtcServices: ran out of memory.\n"})));
}

TEST_F(EtcServicesTest, ReadErrorEndsTheFile) {
  std::string contents = "alpha 1/tcp\n";
  while (contents.size() < 40000) contents += "# filling the first blocks\n";
  writeFile(path, contents + "beta 2/tcp\n");
  EtcServices services;
  {
    const FailingCall read(Call::fread, EIO);
    EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
    ASSERT_TRUE(read.fired());
    EXPECT_THAT(listOf(services), IsEmpty());
  }
  const FailingCall read(Call::fread, EIO, 2);
  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
  ASSERT_TRUE(read.fired());
  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}));
}

// ---- Adding ----

TEST_F(EtcServicesTest, AddsALineAtTheEndAndARecordAtTheHead) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  const Records records;

  EXPECT_EQ(services.addService("beta", 2), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\nbeta\t2/tcp\n");
  EXPECT_THAT(records.trail(),
              ElementsAreArray(
                  member("addService", 0, kNotListed + member("isPortAvaliable", 1) + kGoodFile)));
  EXPECT_THAT(listOf(services), ElementsAre(Service{"beta", 2}, Service{"alpha", 1}));
  EXPECT_EQ(services.addService("gamma", 70000), OSUTILS_SUCCESS);
  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\nbeta\t2/tcp\ngamma\t70000/tcp\n");
  EXPECT_THAT(listOf(services),
              ElementsAre(Service{"gamma", 70000}, Service{"beta", 2}, Service{"alpha", 1}));
}

TEST_F(EtcServicesTest, AddedServiceIsFoundWithoutLoadingAgain) {
  writeFile(path, "");
  EtcServices services;

  EXPECT_EQ(services.addService("alpha", 1), OSUTILS_SUCCESS);

  EXPECT_EQ(services.getServicePort("alpha"), 1);
  EXPECT_FALSE(services.isPortAvaliable(1));
  EXPECT_EQ(services.addService("alpha", 2), OSUTILS_ALREADY_EXISTS);
}

TEST_F(EtcServicesTest, AddsToAnUnfinishedLastLineAsItStands) {
  writeFile(path, "alpha 1/tcp");
  EtcServices services;
  services.readEtcServices();

  EXPECT_EQ(services.addService("beta", 2), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "alpha 1/tcpbeta\t2/tcp\n");
}

TEST_F(EtcServicesTest, RefusesAListedNameBeforeAListedPortBeforeTheFile) {
  writeFile(path, "alpha 1/tcp\n  beta 3700/udp alias # comment\n");
  EtcServices services;
  services.readEtcServices();
  ASSERT_EQ(unlink(path.c_str()), 0);
  Records records;

  EXPECT_EQ(services.addService("alpha", 1), OSUTILS_ALREADY_EXISTS);
  EXPECT_THAT(records.trail(), ElementsAreArray(member("addService", 68, kListed)));

  for (const int port : {3700, 0, -1, 400001, INT_MAX, INT_MIN}) {
    records.clear();
    EXPECT_EQ(services.addService("alias", port), OSUTILS_UNAVAILABLE) << port;
    EXPECT_THAT(records.trail(), ElementsAreArray(member(
                                     "addService", 52, kNotListed + member("isPortAvaliable", 0))));
  }

  EXPECT_EQ(services.addService("alias", 3701), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_FALSE(pathExists(path));
  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}, Service{"beta", 3700}));
}

TEST_F(EtcServicesTest, AddsALongNameWholeButRemembers90Characters) {
  for (const size_t length : {89U, 90U, 91U, 95U}) {
    SCOPED_TRACE(length);
    const std::string name(length, 'n');
    const std::string kept(std::min(length, size_t{90}), 'n');
    writeFile(path, "");
    EtcServices services;

    EXPECT_EQ(services.addService(name.c_str(), 7), OSUTILS_SUCCESS);

    EXPECT_EQ(contentsOf(path), name + "\t7/tcp\n");
    EXPECT_THAT(listOf(services), ElementsAre(Service{kept, 7}));
    EXPECT_EQ(services.doesServiceExist(name.c_str()), length <= 90);
    EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
    EXPECT_THAT(listOf(services), ElementsAre(Service{kept, 7}));
  }
}

TEST_F(EtcServicesTest, AddsANameOf100000Characters) {
  const std::string name(100000, 'n');
  writeFile(path, "");
  EtcServices services;

  EXPECT_EQ(services.addService(name.c_str(), 7), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), name + "\t7/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{std::string(90, 'n'), 7}));
  // Read back in pieces, of which the last one has the port.
  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
  EXPECT_THAT(listOf(services), ElementsAre(Service{std::string(90, 'n'), 7}));
  EXPECT_EQ(services.deleteService(std::string(90, 'n').c_str()), OSUTILS_SUCCESS);
  EXPECT_EQ(contentsOf(path), name + "\t7/tcp\n") << "no word of the file is that name";
}

TEST_F(EtcServicesTest, AddWithoutMemoryForTheRecordChangesNothing) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  const Records records;
  const FailingCall opens(Call::fopen64, 0, kNever);
  const FailingCall allocation(Call::malloc, ENOMEM);

  EXPECT_EQ(services.addService("beta", 2), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(allocation.fired());
  EXPECT_EQ(opens.calls(), 0);
  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}));
  EXPECT_THAT(records.trail(), ElementsAreArray(member(
                                   "addService", 90,
                                   kNotListed + member("isPortAvaliable", 1) + kGoodFile +
                                       Trail{"D EtcServices::addService ran out of memory.\n."})));
}

TEST_F(EtcServicesTest, AddToAFileThatCannotBeOpenedChangesNothing) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;
  const FailingCall open(Call::fopen64, EROFS);

  EXPECT_EQ(services.addService("beta", 2), OSUTILS_INSUFFICIENT_ACCESS);

  ASSERT_TRUE(open.fired());
  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("addService", 50,
                                      kNotListed + member("isPortAvaliable", 1) + kGoodFile +
                                          Trail{"D EtcServices::addService fopen: errno=30\n."})));
}

TEST_F(EtcServicesTest, AddWithoutItsLineChangesNothing) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;
  const FailingCall print(Call::vra_asprintf, ENOMEM);

  EXPECT_EQ(services.addService("beta", 2), OSUTILS_NO_MEMORY);

  ASSERT_TRUE(print.fired());
  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(), ElementsAreArray(member(
                                   "addService", 90,
                                   kNotListed + member("isPortAvaliable", 1) + kGoodFile +
                                       Trail{"D EtcServices::addService vra_asprintf failed.\n"})));
}

TEST_F(EtcServicesTest, AddDoesNotLookAtTheResultsOfWritingAndClosing) {
  for (const Call failing : {Call::fwrite, Call::fclose}) {
    writeFile(path, "alpha 1/tcp\n");
    EtcServices services;
    services.readEtcServices();
    const int descriptors = openDescriptors();
    const LiveAllocations memory;
    const FailingCall failure(failing, ENOSPC);

    EXPECT_EQ(services.addService("beta", 2), OSUTILS_SUCCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(path),
              failing == Call::fwrite ? "alpha 1/tcp\n" : "alpha 1/tcp\nbeta\t2/tcp\n");
    EXPECT_THAT(listOf(services), ElementsAre(Service{"beta", 2}, Service{"alpha", 1}));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(memory.blocks(), sanitizerOwnsMalloc() ? 0 : 1) << "the record";
  }
}

// ---- Deleting ----

TEST_F(EtcServicesTest, DeletesTheLineAndTheRecord) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\ngamma 3/tcp\n");
  EtcServices services;
  services.readEtcServices();
  const int descriptors = openDescriptors();
  const LiveAllocations memory;
  const Records records;

  EXPECT_EQ(services.deleteService("beta"), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\ngamma 3/tcp\n");
  EXPECT_FALSE(pathExists(backup));
  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}, Service{"gamma", 3}));
  EXPECT_EQ(memory.blocks(), 0);
  EXPECT_EQ(openDescriptors(), descriptors);
  EXPECT_THAT(records.trail(),
              ElementsAreArray(
                  member("deleteService", 0, kListed + kGoodFile + copiedToNewFile() + kDeleted)));
}

TEST_F(EtcServicesTest, FreesTheDeletedRecord) {
  REQUIRE_OWN_MALLOC();
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\n");
  const LiveAllocations memory;
  EtcServices services;
  services.readEtcServices();
  EXPECT_EQ(memory.blocks(), 3);

  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_SUCCESS);

  EXPECT_EQ(memory.blocks(), 2);
  EXPECT_THAT(listOf(services), ElementsAre(Service{"beta", 2}));
}

// The record that the name belongs to is freed on the way.
TEST_F(EtcServicesTest, DeletesByTheNameOfTheRecordItself) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\n");
  EtcServices services;
  services.readEtcServices();

  EXPECT_EQ(services.deleteService(services.getServicesEntry("alpha")->name), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "beta 2/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{"beta", 2}));
}

TEST_F(EtcServicesTest, DeletesAllLinesOfANameButOnlyItsFirstRecord) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\nalpha 1/udp\nalpha no port\n");
  EtcServices services;
  services.readEtcServices();

  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "beta 2/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{"beta", 2}, Service{"alpha", 1}));
  EXPECT_TRUE(services.doesServiceExist("alpha"));
  EXPECT_EQ(services.addService("alpha", 5), OSUTILS_ALREADY_EXISTS);
  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
  EXPECT_FALSE(services.doesServiceExist("alpha"));
}

TEST_F(EtcServicesTest, DeleteKeepsEveryOtherLineAsItStands) {
  using namespace std::string_literals;
  const std::string kept =
      "# alpha 1/tcp\n\n   \t\n#alpha\n1alpha 1/tcp\n \t beta  2/tcp\talpha # alpha\r\n"
      "Alpha 3/tcp\nalphabet 4/tcp\nalph 5/tcp\nalpha-x 6/tcp\nALPHA\nnul\0alpha 7/tcp\0\n"s;
  EXPECT_EQ(without("alpha", kept + "alpha 1/tcp\n" + kept), kept + kept);
  EXPECT_EQ(without("alpha", " \t\v\f\r alpha\v1/tcp\n" + kept), kept);
  EXPECT_EQ(without("alpha", kept + "alpha 1"), kept);
  EXPECT_EQ(without("alpha", "alpha 1/tcp\n" + kept + "beta 2"), kept + "beta 2");
  EXPECT_EQ(without("alpha", "alpha 1/tcp\r\nbeta 2/tcp\r\n"), "beta 2/tcp\r\n");
  EXPECT_EQ(without("alpha", "alpha 1/tcp"), "");
  EXPECT_EQ(without("Alpha", "alpha 1/tcp\nAlpha 2/tcp\n"), "alpha 1/tcp\n");
}

TEST_F(EtcServicesTest, DeleteTakesALineWhoseWordEndsAtANul) {
  using namespace std::string_literals;
  EXPECT_EQ(without("alpha", "alpha 1/tcp\nalpha\0more 2/tcp\nbeta 3/tcp\n"s), "beta 3/tcp\n");
}

TEST_F(EtcServicesTest, DeleteTakesLongLinesPieceByPiece) {
  const std::string rest = std::string(1000000, 'x');
  std::string line = "alpha 1/tcp " + rest + "\n";
  EXPECT_EQ(without("alpha", line + "beta 2/tcp\n"), line.substr(1023) + "beta 2/tcp\n");

  // The second piece goes with its newline: the first one is joined by the next line.
  const std::string blanks(1023, ' ');
  EXPECT_EQ(without("alpha", blanks + "alpha 1/tcp\nbeta 2/tcp\n"), blanks + "beta 2/tcp\n");
  for (const size_t length : {1022U, 1023U, 1024U, 1025U}) {
    SCOPED_TRACE(length);
    line = "alpha 7/tcp #";
    line += std::string(length - line.size() - 1, 'x') + "\n";
    EXPECT_EQ(without("alpha", line + "beta 8/tcp\n"),
              (length <= 1023 ? "" : line.substr(1023)) + "beta 8/tcp\n");
    EXPECT_EQ(without("beta", line + "beta 8/tcp\n"), line);
  }
}

TEST_F(EtcServicesTest, DeleteGoesByTheWholeNameInTheFileAndBy90CharactersInTheList) {
  const std::string of90(90, 'n');
  const std::string line = of90 + "nnnnn 7/tcp\n";
  writeFile(path, line + of90 + " 8/tcp\n");
  EtcServices services;
  services.readEtcServices();

  EXPECT_EQ(services.deleteService((of90 + "nnnnn").c_str()), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_EQ(services.deleteService(of90.c_str()), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), line);
  EXPECT_THAT(listOf(services), ElementsAre(Service{of90, 8}));
}

TEST_F(EtcServicesTest, DeleteOfAnUnlistedNameLooksAtNoFile) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp alias\n");
  EtcServices services;
  services.readEtcServices();
  ASSERT_EQ(unlink(path.c_str()), 0);

  for (const char* const name : {"alias", "Alpha", ""}) {
    const Records records;
    EXPECT_EQ(services.deleteService(name), OSUTILS_NO_SUCH_OBJECT);
    EXPECT_THAT(records.trail(), ElementsAreArray(member("deleteService", 32, kNotListed)));
  }
}

TEST_F(EtcServicesTest, DeleteAnswersWhatTheFileIs) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  ASSERT_EQ(unlink(path.c_str()), 0);

  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_NO_SUCH_OBJECT);
  ASSERT_EQ(mkdir(path.c_str(), 0755), 0);
  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_CONSTRAINT_VIOLATION);

  EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}));
  EXPECT_FALSE(pathExists(backup));
}

TEST_F(EtcServicesTest, DeleteFromALinkEditsItsTarget) {
  const std::string target = temp.file("target", "alpha 1/tcp\nbeta 2/tcp\n");
  ASSERT_EQ(chmod(target.c_str(), 0604), 0);
  ASSERT_EQ(symlink(target.c_str(), path.c_str()), 0);
  EtcServices services;
  services.readEtcServices();

  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_SUCCESS);

  EXPECT_TRUE(std::filesystem::is_symlink(path));
  EXPECT_EQ(contentsOf(target), "beta 2/tcp\n");
  EXPECT_EQ(modeOf(target), 0604U);
}

// ---- The backup ----

TEST_F(EtcServicesTest, NewBackupIsWholeAndHasMode0640WhileItExists) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\n");
  EtcServices services;
  services.readEtcServices();
  std::string copied;
  unsigned int mode = 0;
  const BeforeCall opened(
      Call::fopen64,
      [&] {
        copied = contentsOf(backup);
        mode = modeOf(backup);
      },
      3);

  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_SUCCESS);

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(copied, "alpha 1/tcp\nbeta 2/tcp\n");
  EXPECT_EQ(mode, 0640U);
  EXPECT_FALSE(pathExists(backup));
  EXPECT_EQ(umask(022), 026U) << "set for the new backup, and left so";
}

TEST_F(EtcServicesTest, ExistingBackupKeepsItsModeAndIsRemoved) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\n");
  writeFile(backup, "an old copy, which is much longer than the file that replaces it\n");
  ASSERT_EQ(chmod(backup.c_str(), 0600), 0);
  EtcServices services;
  services.readEtcServices();
  std::string copied;
  unsigned int mode = 0;
  const BeforeCall opened(
      Call::fopen64,
      [&] {
        copied = contentsOf(backup);
        mode = modeOf(backup);
      },
      4);

  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_SUCCESS);

  ASSERT_TRUE(opened.fired());
  EXPECT_EQ(copied, "alpha 1/tcp\nbeta 2/tcp\n");
  EXPECT_EQ(mode, 0600U);
  EXPECT_FALSE(pathExists(backup));
  EXPECT_EQ(umask(022), 022U) << "only a new backup sets it";
}

TEST_F(EtcServicesTest, BackupIsMadeWhereItIsWantedAtTheTimeOfTheCall) {
  writeFile(path, "alpha 1/tcp\n");
  EtcServices services;
  services.readEtcServices();
  const std::string elsewhere = temp.path("elsewhere");
  EtcServices::ETC_SERVICES_FILE_BACKUP = elsewhere.c_str();
  bool was_there = false;
  const BeforeCall opened(
      Call::fopen64, [&] { was_there = pathExists(elsewhere); }, 3);

  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_SUCCESS);

  EXPECT_TRUE(was_there);
  EXPECT_FALSE(pathExists(elsewhere));
}

// What a failed copy leaves: the file and the list as they were.
TEST_F(EtcServicesTest, DeleteWithoutABackupChangesNothing) {
  const std::string contents = "alpha 1/tcp\nbeta 2/tcp\n";
  writeFile(path, contents);
  const std::string directory = temp.dir("directory");
  const std::string below_nothing = temp.path("missing/backup");
  const std::string hard_link = temp.path("hard");
  ASSERT_EQ(link(path.c_str(), hard_link.c_str()), 0);
  const std::string soft_link = temp.path("soft");
  ASSERT_EQ(symlink(path.c_str(), soft_link.c_str()), 0);
  const std::string nowhere = temp.path("nowhere");
  ASSERT_EQ(symlink("/dev/null", nowhere.c_str()), 0);
  EtcServices services;
  services.readEtcServices();
  const int descriptors = openDescriptors();

  for (const char* const place :
       {directory.c_str(), below_nothing.c_str(), path.c_str(), hard_link.c_str(),
        soft_link.c_str(), static_cast<const char*>(nullptr)}) {
    const std::string shown = place == nullptr ? "(null)" : place;
    SCOPED_TRACE(shown);
    EtcServices::ETC_SERVICES_FILE_BACKUP = place;
    const Records records;

    EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

    EXPECT_EQ(contentsOf(path), contents);
    EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}, Service{"beta", 2}));
    EXPECT_EQ(openDescriptors(), descriptors);
    const Trail trail = records.trail();
    ASSERT_GE(trail.size(), 2U);
    EXPECT_EQ(trail[trail.size() - 2],
              "D EtcServices::deleteService copy of " + path + " to " + shown + " failed.\n.");
    EXPECT_EQ(trail.back(), "<! EtcServices::deleteService 50");
  }
  EXPECT_TRUE(pathExists(hard_link));
  EXPECT_TRUE(pathExists(soft_link));
}

TEST_F(EtcServicesTest, DeleteTrustsNoBackupThatItCannotExamine) {
  const std::string contents = "alpha 1/tcp\nbeta 2/tcp\n";
  writeFile(path, contents);
  EtcServices services;
  services.readEtcServices();
  // The look at the file behind checkFilePerms, and the last look at the copy.
  for (const int nth : {3, 12}) {
    SCOPED_TRACE(nth);
    const FailingCall status(Call::stat64, EIO, nth);

    EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(status.fired());
    EXPECT_EQ(status.calls(), nth);
    EXPECT_EQ(contentsOf(path), contents);
    EXPECT_TRUE(services.doesServiceExist("alpha"));
  }
  EXPECT_EQ(contentsOf(backup), contents);
}

TEST_F(EtcServicesTest, DeleteReportsTheFailedCopyAfterTheRecordsOfTheCopy) {
  writeFile(path, "alpha 1/tcp\n");
  ASSERT_EQ(mkdir(backup.c_str(), 0755), 0);
  EtcServices services;
  services.readEtcServices();
  const Records records;

  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

  EXPECT_THAT(records.trail(), ElementsAreArray(member(
                                   "deleteService", 50,
                                   kListed + kGoodFile +
                                       call("copyFile", 0,
                                            kCopySource + call("doesFileExist", 1) +
                                                call("canWriteToFile", 0, call("isDirectory", 1))) +
                                       Trail{"D EtcServices::deleteService copy of " + path +
                                             " to " + backup + " failed.\n."})));
}

TEST_F(EtcServicesTest, DeleteByAUserWhoMayNotWriteChangesNothing) {
  REQUIRE_ROOT("to become another user");
  const std::string contents = "alpha 1/tcp\n";
  writeFile(path, contents);
  ASSERT_EQ(chmod(path.c_str(), 0644), 0);
  const std::string open_to_all = temp.dir("open");
  ASSERT_EQ(chmod(open_to_all.c_str(), 0777), 0);
  const std::string writable_backup = open_to_all + "/backup";
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EtcServices services;
                     EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
                     EXPECT_EQ(services.addService("beta", 2), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_FALSE(pathExists(backup));

                     // The backup can be made here, but the file cannot be written.
                     EtcServices::ETC_SERVICES_FILE_BACKUP = writable_backup.c_str();
                     const Records records;
                     EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);
                     EXPECT_FALSE(pathExists(writable_backup));
                     const Trail tail = Trail{"D EtcServices::deleteService fopen: errno=13\n."} +
                                        kDeleted + Trail{"<! EtcServices::deleteService 50"};
                     const Trail trail = records.trail();
                     EXPECT_GT(trail.size(), tail.size());
                     EXPECT_EQ(Trail(trail.end() - static_cast<long>(tail.size()), trail.end()),
                               tail);
                     EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}));
                     return 0;
                   }),
            0);
  EXPECT_EQ(contentsOf(path), contents);
}

TEST_F(EtcServicesTest, DeleteWhenTheBackupOrTheFileCannotBeOpened) {
  const std::string contents = "alpha 1/tcp\nbeta 2/tcp\n";
  const struct {
    bool backup_fails;
    bool file_fails;
    const char* error;
    std::string left;
  } cases[] = {
      {true, false, "24", ""},  // the file was opened, and thereby emptied, all the same
      {false, true, "23", contents},
      {true, true, "23", contents},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(std::to_string(with.backup_fails) + " " + std::to_string(with.file_fails));
    writeFile(path, contents);
    EtcServices services;
    services.readEtcServices();
    const int descriptors = openDescriptors();
    const LiveAllocations memory;
    const Records records;
    const FailingCall backup_open(Call::fopen64, EMFILE, with.backup_fails ? 3 : kNever);
    const FailingCall file_open(Call::fopen64, ENFILE, with.file_fails ? 4 : kNever);

    EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

    EXPECT_EQ(backup_open.calls(), 4) << "both are opened before either is looked at";
    EXPECT_EQ(contentsOf(path), with.left);
    EXPECT_FALSE(pathExists(backup));
    EXPECT_THAT(listOf(services), ElementsAre(Service{"alpha", 1}, Service{"beta", 2}));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(memory.blocks(), 0);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(
                    member("deleteService", 50,
                           kListed + kGoodFile + copiedToNewFile() +
                               Trail{std::string("D EtcServices::deleteService fopen: errno=") +
                                     with.error + "\n."} +
                               kDeleted)));
  }
}

TEST_F(EtcServicesTest, DeleteKeepsTheBackupOfALineThatCouldNotBeWritten) {
  const std::string contents = "alpha 1/tcp\nbeta 2/tcp\ngamma 3/tcp\n";
  const struct {
    Call call;
    int nth;
    std::string left;
  } cases[] = {
      {Call::fwrite, 1, "gamma 3/tcp\n"},
      {Call::fwrite, 2, "beta 2/tcp\n"},
      {Call::fclose, 4, "beta 2/tcp\ngamma 3/tcp\n"},  // behind the copy's two and the backup's
      {Call::fread, 1, ""},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.left);
    writeFile(path, contents);
    EtcServices services;
    services.readEtcServices();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(with.call, EIO, with.nth);

    EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(path), with.left);
    EXPECT_EQ(contentsOf(backup), contents);
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(listOf(services).size(), 3U);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(member("deleteService", 50,
                                        kListed + kGoodFile + copiedToNewFile() +
                                            // The other way round than for the copy to the backup.
                                            Trail{"D EtcServices::deleteService copy of " + backup +
                                                  " to " + path + " failed.\n."})));
    ASSERT_EQ(unlink(backup.c_str()), 0);
  }
}

// A tmpfs of this many bytes in a mount table of the child's own.
bool mountSmallDisk(const std::string& directory, size_t bytes) {
  const std::string options = "size=" + std::to_string(bytes);
  return mount("osutils-test", directory.c_str(), "tmpfs", 0, options.c_str()) == 0;
}

// More than fits on the disk above.
std::string manyLines() {
  std::string lines = "alpha 1/tcp\n";
  while (lines.size() < 40000) lines += "beta 2/tcp # one of very many\n";
  return lines;
}

constexpr size_t kSmallDiskBytes = 64 * 1024;

TEST_F(EtcServicesTest, DeleteTouchesNothingWhenTheBackupDoesNotFitItsDisk) {
  REQUIRE_ROOT("for a small file system");
  const std::string contents = manyLines();
  writeFile(path, contents);
  const std::string disk = temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!mountSmallDisk(disk, 16 * 1024)) return 1;
              const std::string small = disk + "/backup";
              EtcServices::ETC_SERVICES_FILE_BACKUP = small.c_str();
              EtcServices services;
              EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
              const Records records;

              EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

              EXPECT_TRUE(services.doesServiceExist("alpha"));
              EXPECT_THAT(records.texts(),
                          testing::Contains("EtcServices::deleteService copy of " + path + " to " +
                                            small + " failed.\n."));
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(path), contents);
}

TEST_F(EtcServicesTest, DeleteKeepsTheBackupWhenTheDiskFillsUpMeanwhile) {
  REQUIRE_ROOT("for a small file system");
  const std::string contents = manyLines();
  const std::string disk = temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!mountSmallDisk(disk, kSmallDiskBytes)) return 1;
              const std::string small = disk + "/services";
              writeFile(small, contents);
              pointAt(small, backup);
              EtcServices services;
              EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
              // The file has just been emptied: somebody else takes its place.
              const BeforeCall written(Call::fwrite, [&] {
                std::ofstream(disk + "/other") << std::string(2 * kSmallDiskBytes, 'x');
              });

              EXPECT_EQ(services.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

              EXPECT_TRUE(written.fired());
              EXPECT_LT(contentsOf(small).size(), contents.size() / 2);
              EXPECT_TRUE(services.doesServiceExist("alpha"));
              return 0;
            }),
            0);
  EXPECT_EQ(contentsOf(backup), contents);
}

TEST_F(EtcServicesTest, AddToAFullDiskIsNotReported) {
  REQUIRE_ROOT("for a small file system");
  const std::string disk = temp.dir("disk");
  EXPECT_EQ(withPrivateMounts([&] {
              if (!mountSmallDisk(disk, kSmallDiskBytes)) return 1;
              const std::string small = disk + "/services";
              writeFile(small, "");
              std::ofstream(disk + "/other") << std::string(2 * kSmallDiskBytes, 'x');
              pointAt(small, backup);
              EtcServices services;

              EXPECT_EQ(services.addService("alpha", 1), OSUTILS_SUCCESS);

              EXPECT_EQ(contentsOf(small), "");
              EXPECT_TRUE(services.doesServiceExist("alpha"));
              return 0;
            }),
            0);
}

// ---- The disk ----

// Whether the backup is new, old, behind a link or in a folder that the user may not read.
TEST_F(EtcServicesTest, DeleteLosesNoLineWhereverThePowerFails) {
  const std::string contents = std::string("alpha 1/tcp\n") + std::string("beta 2/tcp\n") +
                               "# a comment\n" + std::string("gamma\t3/tcp\n");
  const std::string target = temp.dir("elsewhere") + "/target";
  const struct {
    const char* backup;
    bool is_link;
    bool is_there;
  } cases[] = {{"new", false, false},
               {"old", false, true},
               {"link to an old one", true, true},
               {"link to nothing", true, false}};
  for (const auto& with : cases) {
    SCOPED_TRACE(with.backup);
    writeFile(path, contents);
    const std::string& copy = with.is_link ? target : backup;
    if (with.is_link) {
      ASSERT_EQ(symlink(target.c_str(), backup.c_str()), 0);
    }
    std::map<std::string, std::string> files = {{path, contents}};
    if (with.is_there) {
      writeFile(copy,
                "an old copy, which is much longer than the file that replaces it, all of it\n");
      files[copy] = contentsOf(copy);
    }
    EtcServices editor;
    editor.readEtcServices();
    const FileSteps steps;

    EXPECT_EQ(editor.deleteService("alpha"), OSUTILS_SUCCESS);

    std::map<std::string, std::string> now = {{path, contentsOf(path)}};
    if (with.is_link) now[copy] = contentsOf(copy);  // only the link is removed
    EXPECT_EQ(
        lostLines(steps.all(), files, now,
                  {std::string("beta 2/tcp\n"), "# a comment\n", std::string("gamma\t3/tcp\n")}),
        "");
    unlink(target.c_str());
  }
}

TEST_F(EtcServicesTest, DeleteLosesNoLineInAFolderThatMayNotBeRead) {
  REQUIRE_ROOT("to become another user");
  const std::string contents = std::string("alpha 1/tcp\n") + std::string("beta 2/tcp\n");
  const std::string folder = temp.dir("folder");
  ASSERT_EQ(chmod(temp.path().c_str(), 0755), 0);
  ASSERT_EQ(chmod(folder.c_str(), 0733), 0);
  path = folder + "/file";
  backup = folder + "/backup";
  writeFile(path, contents);
  ASSERT_EQ(chmod(path.c_str(), 0666), 0);
  pointAt(path, backup);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EtcServices editor;
                     editor.readEtcServices();
                     const FileSteps steps;
                     EXPECT_EQ(editor.deleteService("alpha"), OSUTILS_SUCCESS);
                     EXPECT_EQ(lostLines(steps.all(), {{path, contents}},
                                         {{path, std::string("beta 2/tcp\n")}},
                                         {std::string("beta 2/tcp\n")}),
                               "");
                     return 0;
                   }),
            0);
}

TEST_F(EtcServicesTest, DeleteChangesNothingWhenTheBackupCannotBeForcedToTheDisk) {
  const std::string contents = std::string("alpha 1/tcp\n") + std::string("beta 2/tcp\n");
  const struct {
    const char* what;
    Call call;
    int nth;
    Call also;  // fails as well
    int also_nth;
  } cases[] = {
      {"its contents", Call::fsync, 1, Call::syncfs, kNever},
      {"its name", Call::fsync, 2, Call::syncfs, kNever},
      {"its file system", Call::syncfs, 1, Call::open64, 3},  // the folder cannot be opened
      {"nothing of it", Call::open64, 2, Call::syncfs, kNever},
  };
  for (const auto& with : cases) {
    SCOPED_TRACE(with.what);
    writeFile(path, contents);
    EtcServices editor;
    editor.readEtcServices();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(with.call, EIO, with.nth);
    const FailingCall other_failure(with.also, EACCES, with.also_nth);

    EXPECT_EQ(editor.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(path), contents);
    EXPECT_FALSE(pathExists(backup));
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(listOf(editor).size(), 2U);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(member("deleteService", 50,
                                        kListed + kGoodFile + copiedToNewFile() + kDeleted +
                                            Trail{"D EtcServices::deleteService copy of " + path +
                                                  " to " + backup + " failed.\n."})));
  }
}

TEST_F(EtcServicesTest, DeleteKeepsTheBackupWhenTheFileCannotBeForcedToTheDisk) {
  const std::string contents = std::string("alpha 1/tcp\n") + std::string("beta 2/tcp\n");
  for (const Call call : {Call::fsync, Call::fflush}) {
    SCOPED_TRACE(static_cast<int>(call));
    writeFile(path, contents);
    EtcServices editor;
    editor.readEtcServices();
    const int descriptors = openDescriptors();
    const Records records;
    const FailingCall failure(call, EIO, call == Call::fsync ? 3 : 1);

    EXPECT_EQ(editor.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);

    ASSERT_TRUE(failure.fired());
    EXPECT_EQ(contentsOf(backup), contents);
    EXPECT_EQ(openDescriptors(), descriptors);
    EXPECT_EQ(listOf(editor).size(), 2U);
    EXPECT_THAT(records.trail(),
                ElementsAreArray(member("deleteService", 50,
                                        kListed + kGoodFile + copiedToNewFile() +
                                            Trail{"D EtcServices::deleteService copy of " + backup +
                                                  " to " + path + " failed.\n."})));
    ASSERT_EQ(unlink(backup.c_str()), 0);
  }
}

TEST_F(EtcServicesTest, DeleteGoesOnWhereNothingCanBeForcedAndAfterASignal) {
  for (const int reason : {EINVAL, EINTR}) {
    for (const int nth : {1, 2, 3}) {
      SCOPED_TRACE(std::to_string(reason) + " " + std::to_string(nth));
      writeFile(path, std::string("alpha 1/tcp\n") + std::string("beta 2/tcp\n"));
      EtcServices editor;
      editor.readEtcServices();
      const FailingCall failure(Call::fsync, reason, nth);

      EXPECT_EQ(editor.deleteService("alpha"), OSUTILS_SUCCESS);

      ASSERT_TRUE(failure.fired());
      EXPECT_EQ(failure.calls(), reason == EINTR ? 4 : 3);
      EXPECT_EQ(contentsOf(path), std::string("beta 2/tcp\n"));
      EXPECT_FALSE(pathExists(backup));
    }
  }
}

// The folder of the backup is opened by its name, which may be short or too long for a small stack.
TEST_F(EtcServicesTest, DeleteForcesTheBackupsNameWhateverItsPath) {
  const std::string folder = temp.path();
  std::string deep = folder;
  while (deep.size() < 1200)
    deep = temp.dir((deep.substr(folder.size()) + "/0123456789").substr(1));
  const struct {
    std::string path;
    std::string forced;  // nothing for the whole file system
  } cases[] = {{"backup", folder},
               {"./backup", folder},
               {"/osutils-test-backup", "/"},
               {deep + "/backup", ""}};
  for (const auto& with : cases) {
    if (with.forced == "/" && access("/", W_OK) != 0) continue;
    SCOPED_TRACE(with.path);
    EXPECT_EQ(inChild([&] {
                EXPECT_EQ(chdir(folder.c_str()), 0);
                writeFile(path, std::string("alpha 1/tcp\n"));
                pointAt(path, with.path);
                EtcServices editor;
                editor.readEtcServices();
                const FileSteps steps;
                EXPECT_EQ(editor.deleteService("alpha"), OSUTILS_SUCCESS);
                std::string forced = "nothing";
                for (const FileStep& step : steps.all()) {
                  if (step.kind == FileStep::kForcedAll) forced = "";
                  if (step.kind == FileStep::kForced && std::filesystem::is_directory(step.path)) {
                    forced = step.path;
                  }
                }
                EXPECT_EQ(forced, with.forced);
                EXPECT_FALSE(pathExists(with.path));
                return 0;
              }),
              0);
  }
}

TEST_F(EtcServicesTest, DeleteByAUserWhoMayNotReadTheOldBackupEmptiesTheFile) {
  REQUIRE_ROOT("to become another user");
  const std::string folder = temp.dir("folder");
  ASSERT_EQ(chmod(folder.c_str(), 0777), 0);
  path = folder + "/file";
  backup = folder + "/backup";
  writeFile(path, std::string("alpha 1/tcp\n") + std::string("beta 2/tcp\n"));
  ASSERT_EQ(chmod(path.c_str(), 0666), 0);
  writeFile(backup, "old");
  ASSERT_EQ(chmod(backup.c_str(), 0222), 0);
  pointAt(path, backup);
  EXPECT_EQ(asUser(kNobody,
                   [&] {
                     EtcServices editor;
                     editor.readEtcServices();
                     EXPECT_EQ(editor.deleteService("alpha"), OSUTILS_INSUFFICIENT_ACCESS);
                     return 0;
                   }),
            0);
  EXPECT_EQ(contentsOf(path), "");
  EXPECT_FALSE(pathExists(backup));
}

// ---- Cancellation ----

// Every call of an edit, as the one that a request to end the thread comes with. The edit is
// finished all the same, and the thread ends behind it.
TEST_F(EtcServicesTest, EditsAreFinishedByAThreadThatIsCancelled) {
  const std::string contents = std::string("alpha 1/tcp\n") + std::string("beta 2/tcp\n");
  const struct {
    const char* what;
    std::function<int(EtcServices&)> edit;
    std::vector<Call> calls;
    std::string left;
    int blocks;  // of the list
  } cases[] = {
      {"load",
       [](EtcServices& editor) { return editor.readEtcServices(); },
       {Call::stat64, Call::fopen64, Call::allocation, Call::fread, Call::fclose},
       contents,
       2},
      {"add",
       [](EtcServices& editor) { return editor.addService("gamma", 3); },
       {Call::stat64, Call::allocation, Call::fopen64, Call::vra_asprintf, Call::fwrite,
        Call::fclose},
       contents + std::string("gamma\t3/tcp\n"),
       1},
      {"delete",
       [](EtcServices& editor) { return editor.deleteService("alpha"); },
       {Call::stat64, Call::open64, Call::fchown, Call::close, Call::fopen64, Call::copy_file_range,
        Call::read, Call::fsync, Call::fread, Call::fwrite, Call::fflush, Call::fclose,
        Call::remove},
       std::string("beta 2/tcp\n"),
       0},
  };
  for (const auto& with : cases) {
    for (const Call at : with.calls) {
      if (at == Call::allocation && sanitizerOwnsMalloc()) continue;
      SCOPED_TRACE(with.what + (" " + std::to_string(static_cast<int>(at))));
      EXPECT_EQ(inChild([&] {
                  for (int nth = 1;; ++nth) {
                    SCOPED_TRACE(nth);
                    writeFile(path, contents);
                    EtcServices editor;
                    if (with.blocks != 2) editor.readEtcServices();
                    const int descriptors = openDescriptors();
                    int answer = -1;
                    const CancelledCall call =
                        cancelledAt(at, nth, [&] { answer = with.edit(editor); });
                    EXPECT_TRUE(call.returned);
                    EXPECT_EQ(answer, OSUTILS_SUCCESS);
                    EXPECT_EQ(call.ended, call.asked);
                    EXPECT_EQ(contentsOf(path), with.left);
                    EXPECT_FALSE(pathExists(backup));
                    EXPECT_EQ(openDescriptors(), descriptors);
                    EXPECT_EQ(call.blocks, sanitizerOwnsMalloc() ? 0 : with.blocks);
                    if (!call.asked || testing::Test::HasFailure()) return nth == 1 ? 1 : 0;
                  }
                }),
                0);
    }
  }
}

// ---- Any file ----

// The pieces of a file as the editor must see them, found in the plainest way.
std::vector<std::string> piecesOf(const std::string& contents) {
  std::vector<std::string> pieces;
  bool complete = true;
  for (const char c : contents) {
    if (complete) pieces.emplace_back();
    pieces.back() += c;
    complete = c == '\n' || pieces.back().size() == 1023;
  }
  return pieces;
}

// Takes from the text's beginning what belongs to the set, or what does not.
std::string take(std::string& text, const std::string& set, bool belongs) {
  size_t length = 0;
  while (length < text.size() && (set.find(text[length]) != std::string::npos) == belongs) ++length;
  const std::string taken = text.substr(0, length);
  text.erase(0, length);
  return taken;
}

const std::string kSpace = " \t\n\v\f\r";
const std::string kDigits = "0123456789";
const std::string kLetters = "abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ";

// The first word of a piece when it begins with a letter; `rest` is what follows it.
std::string serviceWord(const std::string& piece, std::string& rest) {
  rest = piece.substr(0, piece.find('\0'));
  take(rest, kSpace, true);
  const std::string word = take(rest, kSpace, false);
  return !word.empty() && kLetters.find(word[0]) != std::string::npos ? word : "";
}

std::vector<Service> modelList(const std::string& contents) {
  std::vector<Service> list;
  for (const std::string& piece : piecesOf(contents)) {
    std::string rest;
    const std::string word = serviceWord(piece, rest);
    if (word.empty()) continue;
    take(rest, kSpace, true);
    const std::string digits = take(rest, kDigits, true);
    if (digits.empty()) continue;
    long port = 0;
    for (const char digit : digits) {
      if (__builtin_mul_overflow(port, 10, &port) ||
          __builtin_add_overflow(port, digit - '0', &port)) {
        port = LONG_MAX;
        break;
      }
    }
    list.push_back({word.substr(0, 90), static_cast<int>(port)});
  }
  return list;
}

std::string modelDelete(const std::string& name, const std::string& contents) {
  std::string left;
  for (const std::string& piece : piecesOf(contents)) {
    std::string rest;
    if (serviceWord(piece, rest) != name) left += piece;
  }
  return left;
}

class RandomFile {
 public:
  explicit RandomFile(unsigned int seed) : random_(seed) {}

  size_t below(size_t limit) { return random_() % limit; }

  std::string contents() {
    std::string made;
    const size_t parts = below(60) + (below(20) == 0 ? 3000 : 0);
    for (size_t i = 0; i < parts; ++i) made += part();
    return made;
  }

 private:
  std::string part() {
    using namespace std::string_literals;
    static const std::string alphabet = "ab#/ \t\r\v\n\0-_.+0\x80\xFF"s;
    switch (below(12)) {
      case 0:
      case 1:
        return name() + "\t" + std::to_string(below(100000)) + "/tcp\n";
      case 2:
        return "  " + name() + " " + std::to_string(below(100000)) + "/udp alias # comment\n";
      case 3:
        return "\n";
      case 4:
        // About as long as a piece, or as a name.
        if (below(8) == 0)
          return std::string(below(2) == 0 ? 1010 + below(30) : 80 + below(20), "ab #\v"[below(5)]);
        return name();
      case 5:
        return std::to_string(below(100000));
      default:
        return std::string(1, alphabet[below(alphabet.size())]);
    }
  }

  // Few, so that they repeat.
  std::string name() { return std::string(1 + below(2), "abC"[below(3)]); }

  std::mt19937 random_;
};

constexpr unsigned int kFiles = 2000;

TEST_F(EtcServicesTest, LoadsFromAnyFileWhatAPlainParserFinds) {
  size_t services_seen = 0;
  for (unsigned int seed = 1; seed <= kFiles; ++seed) {
    SCOPED_TRACE(seed);
    const std::string contents = RandomFile(seed).contents();
    const std::vector<Service> list = loaded(contents);
    ASSERT_EQ(list, modelList(contents));
    services_seen += list.size();
  }
  EXPECT_GT(services_seen, kFiles) << "otherwise this says little";
}

TEST_F(EtcServicesTest, DeletesFromAnyFileTheLinesOfThatName) {
  size_t deletions = 0;
  for (unsigned int seed = 1; seed <= kFiles / 10; ++seed) {
    SCOPED_TRACE(seed);
    RandomFile random(seed);
    const std::string contents = random.contents();
    const std::vector<Service> list = modelList(contents);
    if (list.empty()) continue;
    const std::string name = list[random.below(list.size())].name;
    ASSERT_EQ(without(name, contents), modelDelete(name, contents));
    ++deletions;
  }
  EXPECT_GT(deletions, kFiles / 20);
}

TEST_F(EtcServicesTest, AddingAndDeletingANewServiceLeavesAFinishedFileAsItWas) {
  for (unsigned int seed = 1; seed <= kFiles / 10; ++seed) {
    SCOPED_TRACE(seed);
    RandomFile random(seed);
    const std::string contents = random.contents() + "\n";
    writeFile(path, contents);
    EtcServices services;
    ASSERT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
    const std::vector<Service> before = listOf(services);
    const std::string name = "new" + std::string(random.below(88), 'n');

    ASSERT_EQ(services.addService(name.c_str(), services.findAvaliablePort(3700)), OSUTILS_SUCCESS);
    ASSERT_NE(contentsOf(path), contents);
    ASSERT_EQ(services.deleteService(name.c_str()), OSUTILS_SUCCESS);

    ASSERT_EQ(contentsOf(path), contents);
    ASSERT_EQ(listOf(services), before);
  }
}

}  // namespace
