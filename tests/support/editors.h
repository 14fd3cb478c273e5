// The fixture of the tests of both editors, and one interface for the tests that both share.
#pragma once

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <stdlib.h>
#include <string.h>
#include <sys/stat.h>
#include <unistd.h>

#include <ostream>
#include <string>
#include <vector>

#include "osutils.h"
#include "services_model.h"
#include "trails.h"
#include "world.h"

// The member of an editor at this offset: the path is at 8, the list at 16.
template <typename Field, typename Editor>
Field fieldAt(const Editor& editor, size_t offset) {
  Field field;
  memcpy(&field, reinterpret_cast<const char*>(&editor) + offset, sizeof field);
  return field;
}

// ---- Services ----

inline void PrintTo(const Service& service, std::ostream* out) {
  *out << "\"" << service.name << "\" " << service.port;
}

inline std::vector<Service> listOf(const VRAOSUtils::EtcServices& services) {
  std::vector<Service> list;
  for (const auto* entry = fieldAt<const VRAOSUtils::ServicesEntry*>(services, 16);
       entry != nullptr; entry = entry->next) {
    list.push_back({entry->name, entry->port});
  }
  return list;
}

struct ServicesTraits {
  using Entry = Service;

  static constexpr const char* kClass = "EtcServices";

  static Trail member(const std::string& name, int code, const Trail& inside = {}) {
    return call("EtcServices::" + name, code, inside);
  }
  static Trail reading(int code, const Trail& inside = {}) {
    return member("readEtcServices", code, inside);
  }
  static Trail adding(int code, const Trail& inside = {}) {
    return member("addService", code, inside);
  }
  static Trail deleting(int code, const Trail& inside = {}) {
    return member("deleteService", code, inside);
  }
  static inline const Trail kFreed = member("freeServicesEntries", 0, {});
  static inline const Trail kListed =
      member("doesServiceExist", 1, member("getServicesEntry", 0, {}));
  static inline const Trail kNotListed =
      member("doesServiceExist", 0, member("getServicesEntry", 0, {}));
  // The queries of an addition before it opens the file.
  static inline const Trail kAddable = kNotListed + member("isPortAvaliable", 1, {});

  static inline const Service kAlpha = {"alpha", 1};
  static inline const Service kBeta = {"beta", 2};
  static inline const Service kGamma = {"gamma", 3};
  static std::string lineOf(const Service& service) {
    return service.name + "\t" + std::to_string(service.port) + "/tcp\n";
  }
  // A line without an entry, and how many records the editor allocates for it.
  static constexpr const char* kIncompleteLine = "no-port\n";
  static constexpr int kRecordsOfIncompleteLine = 1;

  static std::string readOpenFailed(int error) {
    return "EtcServices: fopen: errno =" + std::to_string(error) + "\n";
  }
  static constexpr const char* kReadWithoutMemory =
      "EtcServices: readEtcServices: ran out of memory.\n";
  static constexpr const char* kAddWithoutMemory = "EtcServices::addService ran out of memory.\n.";
  static constexpr const char* kAddWithoutLine = "EtcServices::addService vra_asprintf failed.\n";
  static std::string addOpenFailed(int error) {
    return "EtcServices::addService fopen: errno=" + std::to_string(error) + "\n.";
  }
  static std::string deleteOpenFailed(int error) {
    return "EtcServices::deleteService fopen: errno=" + std::to_string(error) + "\n.";
  }
  static std::string copyFailed(const std::string& from, const std::string& to) {
    return "EtcServices::deleteService copy of " + from + " to " + to + " failed.\n.";
  }

  static const char*& file() { return VRAOSUtils::EtcServices::ETC_SERVICES_FILE; }
  static const char*& fileBackup() { return VRAOSUtils::EtcServices::ETC_SERVICES_FILE_BACKUP; }
};

struct ServicesEditor : VRAOSUtils::EtcServices, ServicesTraits {
  int read() { return readEtcServices(); }
  int add(const Service& service) { return addService(service.name.c_str(), service.port); }
  int remove(const std::string& name) { return deleteService(name.c_str()); }
  int remove(const Service& service) { return remove(service.name); }
  bool lists(const Service& service) { return doesServiceExist(service.name.c_str()); }
  void freeEntries() { freeServicesEntries(); }
};

// ---- Inittab entries ----

struct Entry {
  std::string id;
  std::string runlevels;
  std::string action;
  std::string process;
  bool operator==(const Entry&) const = default;
};

inline void PrintTo(const Entry& entry, std::ostream* out) {
  *out << "\"" << entry.id << "\" \"" << entry.runlevels << "\" \"" << entry.action << "\" \""
       << entry.process << "\"";
}

// The value in the array, which may lack a NUL.
template <size_t Size>
std::string valueOf(const char (&field)[Size]) {
  return std::string(field, strnlen(field, Size));
}

inline Entry entryOf(const VRAOSUtils::InittabEntry& entry) {
  return {valueOf(entry.id), valueOf(entry.runlevels), valueOf(entry.action),
          valueOf(entry.process)};
}

inline const VRAOSUtils::InittabEntry* headOf(const VRAOSUtils::EtcInittab& inittab) {
  return fieldAt<const VRAOSUtils::InittabEntry*>(inittab, 16);
}

inline std::vector<Entry> listOf(const VRAOSUtils::EtcInittab& inittab) {
  std::vector<Entry> list;
  for (const auto* entry = headOf(inittab); entry != nullptr; entry = entry->next) {
    list.push_back(entryOf(*entry));
  }
  return list;
}

// Copies the string and frees it.
inline std::string taken(char* owned) {
  if (owned == nullptr) return "(none)";
  std::string text = owned;
  free(owned);
  return text;
}

struct InittabTraits {
  using Entry = ::Entry;

  static constexpr const char* kClass = "EtcInittab";

  static Trail member(const std::string& name, int code, const Trail& inside = {}) {
    return call("EtcInittab::" + name, code, inside);
  }
  static Trail reading(int code, const Trail& inside = {}) {
    return member("readInittab", code, inside);
  }
  static Trail adding(int code, const Trail& inside = {}) {
    return member("addInittabEntry", code, inside);
  }
  static Trail deleting(int code, const Trail& inside = {}) {
    return member("deleteInittabEntry", code, inside);
  }
  static inline const Trail kFreed = member("freeInittabEntries", 0, {});
  static inline const Trail kListed =
      member("doesInittabEntryExist", 1, member("getInittabEntry", 0, {}));
  static inline const Trail kNotListed =
      member("doesInittabEntryExist", 0, member("getInittabEntry", 0, {}));
  static inline const Trail kAddable = kNotListed;

  static inline const Entry kAlpha = {"al", "2", "respawn", "/bin/alpha"};
  static inline const Entry kBeta = {"be", "35", "once", "/bin/beta -x"};
  static inline const Entry kGamma = {"ga", "", "off", "/bin/gamma"};
  static std::string lineOf(const Entry& entry) {
    return entry.id + ":" + entry.runlevels + ":" + entry.action + ":" + entry.process + "\n";
  }
  static constexpr const char* kIncompleteLine = "# no entry\n";
  static constexpr int kRecordsOfIncompleteLine = 0;

  static std::string readOpenFailed(int error) {
    return "EtcInittab: fopen: errno =" + std::to_string(error) + "\n";
  }
  static constexpr const char* kReadWithoutMemory = "EtcInittab: readInittab: ran out of memory.\n";
  static constexpr const char* kAddWithoutMemory =
      "EtcInittab::addInittabEntry ran out of memory.\n";
  static constexpr const char* kAddWithoutLine =
      "EtcInittab::addInittabEntry vra_asprintf failed.\n";
  static std::string addOpenFailed(int error) {
    return "EtcInittab::addInittabEntry fopen: errno=" + std::to_string(error) + ".\n";
  }
  static std::string deleteOpenFailed(int error) {
    return "EtcInittab::deleteInittabEntry fopen: errno=" + std::to_string(error) + ".\n";
  }
  static std::string copyFailed(const std::string& from, const std::string& to) {
    return "EtcInittab::deleteInittabEntry copy of " + from + " to " + to + " failed.\n";
  }

  static const char*& file() { return VRAOSUtils::EtcInittab::ETC_INITTAB_FILE; }
  static const char*& fileBackup() { return VRAOSUtils::EtcInittab::ETC_INITTAB_FILE_BACKUP; }
};

struct InittabEditor : VRAOSUtils::EtcInittab, InittabTraits {
  int read() { return readInittab(); }
  int add(const ::Entry& entry) {
    return addInittabEntry(entry.id.c_str(), entry.runlevels.c_str(), entry.action.c_str(),
                           entry.process.c_str());
  }
  int remove(const std::string& id) { return deleteInittabEntry(id.c_str()); }
  int remove(const ::Entry& entry) { return remove(entry.id); }
  bool lists(const ::Entry& entry) { return doesInittabEntryExist(entry.id.c_str()); }
  void freeEntries() { freeInittabEntries(); }
};

// ---- Fixture ----

// Points the editor at files in a directory of the test.
template <typename Editor>
class EditorTest : public testing::Test {
 protected:
  EditorTest() : mask_(umask(022)) { pointAt(path, backup); }
  ~EditorTest() override {
    Editor::file() = original_;
    Editor::fileBackup() = original_backup_;
    umask(mask_);
  }

  static void pointAt(const std::string& file, const std::string& copy) {
    Editor::file() = file.c_str();
    Editor::fileBackup() = copy.c_str();
  }

  void fill(const std::string& contents) const {
    unlink(path.c_str());  // ext4 flushes a truncated file at its next close (auto_da_alloc)
    writeFile(path, contents);
  }

  // The list loaded from a file with these contents.
  std::vector<typename Editor::Entry> loaded(const std::string& contents) const {
    fill(contents);
    Editor editor;
    EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);
    return listOf(editor);
  }

  // The contents after the deletion.
  std::string without(const std::string& name, const std::string& contents) const {
    fill(contents);
    Editor editor;
    EXPECT_EQ(editor.read(), OSUTILS_SUCCESS);
    EXPECT_EQ(editor.remove(name), OSUTILS_SUCCESS) << name;
    EXPECT_FALSE(pathExists(backup));
    return contentsOf(path);
  }

  const TempDir temp;
  std::string path = temp.path("file");
  std::string backup = temp.path("file.save");
  const std::string alpha_line = Editor::lineOf(Editor::kAlpha);
  const std::string beta_line = Editor::lineOf(Editor::kBeta);
  const std::string gamma_line = Editor::lineOf(Editor::kGamma);

 private:
  const char* const original_ = Editor::file();
  const char* const original_backup_ = Editor::fileBackup();
  const mode_t mask_;
};

class EtcInittabTest : public EditorTest<InittabEditor>, protected InittabTraits {
 protected:
  ~EtcInittabTest() override { VRAOSUtils::EtcInittab::ETC_INITTAB_PREFIX_ID = original_prefix_; }

 private:
  const char* const original_prefix_ = VRAOSUtils::EtcInittab::ETC_INITTAB_PREFIX_ID;
};

// ---- Both editors ----

using BothEditors = testing::Types<ServicesEditor, InittabEditor>;
