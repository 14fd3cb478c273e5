#include <errno.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <limits.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <optional>
#include <random>
#include <set>
#include <string>
#include <type_traits>
#include <vector>

#include "editors.h"
#include "faults.h"
#include "osutils.h"
#include "records.h"
#include "services_model.h"
#include "trails.h"
#include "world.h"

using testing::ElementsAre;
using testing::ElementsAreArray;
using testing::IsEmpty;
using VRAOSUtils::EtcServices;
using VRAOSUtils::ServicesEntry;

namespace {

// ---- Fixture ----

class EtcServicesTest : public EditorTest<ServicesEditor>, protected ServicesTraits {};

// ---- Constants and layout ----

TEST(EtcServicesClass, HasItsPublishedConstants) {
  static_assert(std::is_same_v<decltype(EtcServices::ETC_SERVICES_FILE), const char*>);
  static_assert(std::is_same_v<decltype(EtcServices::ETC_SERVICES_FILE_BACKUP), const char*>);
  static_assert(std::is_same_v<decltype(EtcServices::ETC_SERVICE_MIN_PORT), const int>);
  EXPECT_STREQ(EtcServices::ETC_SERVICES_FILE, "/etc/services");
  EXPECT_STREQ(EtcServices::ETC_SERVICES_FILE_BACKUP, "/etc/services.vrasave");

  // By address: the library must define them.
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
  EXPECT_NE(fieldAt<const char*>(services, 8), EtcServices::ETC_SERVICES_FILE) << "not copied";
  EXPECT_EQ(fieldAt<const ServicesEntry*>(services, 16), nullptr);
}

TEST_F(EtcServicesTest, FieldsArePathAndList) {
  writeFile(path, "alpha 1/tcp\n");
  ServicesEditor services;
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

  std::optional<ServicesEditor> services;
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
  ServicesEditor services;
  services.readEtcServices();
  EXPECT_EQ(services.getServicePort("alpha"), 1);

  EXPECT_THAT(records.trail(), ElementsAreArray(kFreed + member("getServicesEntry", 0)));
}

// ---- Queries ----

TEST_F(EtcServicesTest, WithoutLoadingEveryNameIsAbsentAndEveryPortFree) {
  writeFile(path, "alpha 1/tcp\n");
  ServicesEditor services;

  EXPECT_FALSE(services.doesServiceExist("alpha"));
  EXPECT_EQ(services.getServicePort("alpha"), -1);
  EXPECT_EQ(services.getServicesEntry("alpha"), nullptr);
  EXPECT_TRUE(services.isPortAvaliable(1));
  EXPECT_EQ(services.findAvaliablePort(0), 1);
  EXPECT_EQ(services.deleteService("alpha"), OSUTILS_NO_SUCH_OBJECT);
}

TEST_F(EtcServicesTest, NoEntryHasANullName) {
  writeFile(path, "alpha 1/tcp\n");
  ServicesEditor services;
  services.readEtcServices();
  EXPECT_EQ(services.getServicesEntry(nullptr), nullptr);
  EXPECT_FALSE(services.doesServiceExist(nullptr));
  EXPECT_EQ(services.getServicePort(nullptr), -1);
}

TEST_F(EtcServicesTest, QuestionsAboutANullNameSayWhichFunctionWasAsked) {
  ServicesEditor services;
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
  ServicesEditor services;
  services.readEtcServices();

  EXPECT_TRUE(services.doesServiceExist("Alpha"));
  for (const char* const other : {"alpha", "ALPHA", "Alph", "Alpha ", "", "alphabe"}) {
    EXPECT_FALSE(services.doesServiceExist(other)) << other;
    EXPECT_EQ(services.getServicePort(other), -1) << other;
  }
}

TEST_F(EtcServicesTest, ANameGoesToTheNextSpaceWhateverItsCharacters) {
  const std::string name = "al\x01pha\x7F\xFF";
  writeFile(path, name + " 1/tcp\n");
  ServicesEditor services;
  services.readEtcServices();

  EXPECT_EQ(services.getServicePort(name.c_str()), 1);
}

TEST_F(EtcServicesTest, FirstRecordOfANameAnswers) {
  writeFile(path, "alpha 1/tcp\nalpha 2/udp\n");
  ServicesEditor services;
  services.readEtcServices();
  const Records records;

  EXPECT_EQ(services.getServicePort("alpha"), 1);

  // The port is not a result code: the exit record has 0.
  EXPECT_THAT(records.trail(),
              ElementsAreArray(member("getServicePort", 0, member("getServicesEntry", 0))));
  EXPECT_EQ(services.getServicesEntry("alpha"), fieldAt<ServicesEntry*>(services, 16));
}

TEST_F(EtcServicesTest, PortsAreFreeFrom1To400000UnlessListed) {
  writeFile(path, "alpha 3700/udp\nfar 500000/tcp\nnone 0/tcp\n");
  ServicesEditor services;
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
  ServicesEditor services;
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
  ServicesEditor services;
  services.readEtcServices();

  for (const int start : {0, -1, INT_MIN, 1, 2, 3}) {
    EXPECT_EQ(services.findAvaliablePort(start), 3) << start;
  }
  EXPECT_EQ(services.findAvaliablePort(3700), 3700);
  EXPECT_EQ(services.findAvaliablePort(400000), 400000);
  EXPECT_EQ(services.findAvaliablePort(400001), -1);
  EXPECT_EQ(services.findAvaliablePort(INT_MAX), -1);
}

// The lines of a file with these ports and with a few invalid ones.
std::string linesWithPorts(const std::vector<int>& ports) {
  std::string lines = "none 0/tcp\nlarge 400001/tcp\nlarger 4000000000/tcp\n";
  for (const int port : ports)
    lines += "s" + std::to_string(port) + " " + std::to_string(port) + "/tcp\n";
  return lines;
}

// While traced, the search calls isPortAvaliable for each port.
TEST_F(EtcServicesTest, SearchForAPortFindsTheSameWhetherItIsTracedOrNot) {
  std::minstd_rand next(1);
  std::vector<int> ports;
  for (int port = 16000; port < 17000; ++port) ports.push_back(port);
  for (int port = 30000; port < 50100; ++port) {
    if (port % 1000 != 7) ports.push_back(port);
  }
  for (int i = 0; i < 300; ++i) ports.push_back(1 + static_cast<int>(next() % 400));
  for (int port = 399900; port <= 400000; ++port) {
    if (port % 10 != 3) ports.push_back(port);
  }
  writeFile(path, linesWithPorts(ports));
  ServicesEditor services;
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

// A search that reads the list once for each port would take hours.
TEST_F(EtcServicesTest, SearchForAPortEndsWhenAllAreTaken) {
  std::vector<int> ports;
  for (int port = 400000; port > 0; --port) ports.push_back(port);
  writeFile(path, linesWithPorts(ports));
  ServicesEditor services;
  ASSERT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);

  EXPECT_EQ(services.findAvaliablePort(1), -1);
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
  // The word after the blanks is cut at the boundary, or begins after it.
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
  // The first piece has a name without a port, the second one a port without a name.
  for (const char* const line : {"alpha 7/tcp\n", "alpha  7/tcp\n"}) {
    SCOPED_TRACE(line);
    EXPECT_THAT(loaded(std::string(1018, ' ') + line + "beta 8/tcp\n"),
                ElementsAre(Service{"beta", 8}));
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
  constexpr int kLines = 1'000'000;
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

// ---- Adding ----

TEST_F(EtcServicesTest, AddsAPortAbove65535) {
  writeFile(path, "alpha 1/tcp\n");
  ServicesEditor services;
  services.readEtcServices();

  EXPECT_EQ(services.addService("gamma", 70000), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "alpha 1/tcp\ngamma\t70000/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{"gamma", 70000}, Service{"alpha", 1}));
}

TEST_F(EtcServicesTest, AddedServiceIsFoundWithoutLoadingAgain) {
  writeFile(path, "");
  ServicesEditor services;

  EXPECT_EQ(services.addService("alpha", 1), OSUTILS_SUCCESS);

  EXPECT_EQ(services.getServicePort("alpha"), 1);
  EXPECT_FALSE(services.isPortAvaliable(1));
  EXPECT_EQ(services.addService("alpha", 2), OSUTILS_ALREADY_EXISTS);
}

TEST_F(EtcServicesTest, RefusesAListedNameBeforeAListedPortBeforeTheFile) {
  writeFile(path, "alpha 1/tcp\n  beta 3700/udp alias # comment\n");
  ServicesEditor services;
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
    ServicesEditor services;

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
  ServicesEditor services;

  EXPECT_EQ(services.addService(name.c_str(), 7), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), name + "\t7/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{std::string(90, 'n'), 7}));
  // Read back in pieces; only the last one has a port.
  EXPECT_EQ(services.readEtcServices(), OSUTILS_SUCCESS);
  EXPECT_THAT(listOf(services), ElementsAre(Service{std::string(90, 'n'), 7}));
  EXPECT_EQ(services.deleteService(std::string(90, 'n').c_str()), OSUTILS_SUCCESS);
  EXPECT_EQ(contentsOf(path), name + "\t7/tcp\n") << "the word in the file is longer";
}

// ---- Deleting ----

// The call frees the record that holds its argument.
TEST_F(EtcServicesTest, DeletesByTheNameOfTheRecordItself) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\n");
  ServicesEditor services;
  services.readEtcServices();

  EXPECT_EQ(services.deleteService(services.getServicesEntry("alpha")->name), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), "beta 2/tcp\n");
  EXPECT_THAT(listOf(services), ElementsAre(Service{"beta", 2}));
}

TEST_F(EtcServicesTest, DeletesAllLinesOfANameButOnlyItsFirstRecord) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp\nalpha 1/udp\nalpha no port\n");
  ServicesEditor services;
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

  // The second piece is deleted with its newline, so the next line joins the first piece.
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
  ServicesEditor services;
  services.readEtcServices();

  EXPECT_EQ(services.deleteService((of90 + "nnnnn").c_str()), OSUTILS_NO_SUCH_OBJECT);
  EXPECT_EQ(services.deleteService(of90.c_str()), OSUTILS_SUCCESS);

  EXPECT_EQ(contentsOf(path), line);
  EXPECT_THAT(listOf(services), ElementsAre(Service{of90, 8}));
}

TEST_F(EtcServicesTest, DeleteOfAnUnlistedNameLooksAtNoFile) {
  writeFile(path, "alpha 1/tcp\nbeta 2/tcp alias\n");
  ServicesEditor services;
  services.readEtcServices();
  ASSERT_EQ(unlink(path.c_str()), 0);

  for (const char* const name : {"alias", "Alpha", ""}) {
    const Records records;
    EXPECT_EQ(services.deleteService(name), OSUTILS_NO_SUCH_OBJECT);
    EXPECT_THAT(records.trail(), ElementsAreArray(member("deleteService", 32, kNotListed)));
  }
}

// ---- Random files ----

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
        // Near the length limit of a piece or of a name.
        if (below(8) == 0)
          return std::string(below(2) == 0 ? 1010 + below(30) : 80 + below(20), "ab #\v"[below(5)]);
        return name();
      case 5:
        return std::to_string(below(100000));
      default:
        return std::string(1, alphabet[below(alphabet.size())]);
    }
  }

  // Few names, so that they repeat.
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
    ASSERT_EQ(list, modelServices(contents));
    services_seen += list.size();
  }
  EXPECT_GT(services_seen, kFiles) << "too few to prove anything";
}

TEST_F(EtcServicesTest, DeletesFromAnyFileTheLinesOfThatName) {
  size_t deletions = 0;
  for (unsigned int seed = 1; seed <= kFiles / 10; ++seed) {
    SCOPED_TRACE(seed);
    RandomFile random(seed);
    const std::string contents = random.contents();
    const std::vector<Service> list = modelServices(contents);
    if (list.empty()) continue;
    const std::string name = list[random.below(list.size())].name;
    ASSERT_EQ(without(name, contents), modelWithoutService(name, contents));
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
    ServicesEditor services;
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
