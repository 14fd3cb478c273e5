// Screening, names, distinguished names.

#include "osutils.h"
#include "scenario.h"

namespace scenarios {
namespace {

Scenario predicate(bool function(char*), const std::string& symbol, const std::string& name,
                   const char* input, bool result) {
  return {.name = symbol + ", " + name,
          .symbols = {symbol},
          .run =
              [=] {
                if (input == nullptr) return shown(function(nullptr));
                std::string copy = input;
                return shown(function(copy.data()));
              },
          .ends = {{kNothing, shown(result)}}};
}

Scenario metaChars(const std::string& name, const char* input, bool result) {
  return predicate(checkForMetaChars, "checkForMetaChars", name, input, result);
}

Scenario validName(const std::string& name, const char* input, bool result) {
  return predicate(isValidName, "isValidName", name, input, result);
}

Scenario options(const std::string& name, int count, std::vector<std::string> arguments,
                 const std::string& result) {
  return {.name = "checkOptionsForMetaChars, " + name,
          .symbols = {"checkOptionsForMetaChars"},
          .run =
              [count, arguments] {
                std::vector<std::string> copies = arguments;
                std::vector<char*> vector;
                for (std::string& copy : copies) vector.push_back(copy.data());
                vector.push_back(nullptr);
                return shown(checkOptionsForMetaChars(count, vector.data()));
              },
          .ends = {{kNothing, result}}};
}

// The name itself must not change.
Scenario format(const std::string& name, const std::string& dn, const std::string& result) {
  Scenario scenario{.name = "formatDn, " + name,
                    .symbols = {"formatDn"},
                    .run =
                        [dn] {
                          std::string copy = dn;
                          std::string shown = freed(formatDn(copy.data()));
                          return copy == dn ? shown : shown + ", argument changed to " + copy;
                        },
                    .ends = {{kNothing, result}}};
  if (result != "null") scenario.ends.push_back({kMemory, "null"});
  return scenario;
}

Scenario compare(const std::string& name, const std::string& a, const std::string& b,
                 const std::string& result) {
  return {.name = "compareDns, " + name,
          .symbols = {"compareDns"},
          .run =
              [a, b] {
                std::string first = a;
                std::string second = b;
                return shown(compareDns(first.data(), second.data()));
              },
          .ends = {{kNothing, result}, {kMemory, "false"}}};
}

}  // namespace

std::vector<Scenario> nameScenarios() {
  return {
      metaChars("none", "a b\t!c", false),
      metaChars("the first", "a&", true),
      metaChars("the last", "\\a", true),
      metaChars("a line feed", "a\nb", true),
      metaChars("empty", "", false),
      metaChars("null", nullptr, false),
      options("none", 2, {"p", "a", "b"}, "false"),
      options("in the last", 2, {"p", "a", "b;"}, "true"),
      options("in the program's name alone", 2, {";", "ok"}, "false"),
      options("no arguments", 0, {"p", ";"}, "false"),
      {.name = "checkOptionsForMetaChars, null",
       .symbols = {"checkOptionsForMetaChars"},
       .run = [] { return shown(checkOptionsForMetaChars(1, nullptr)); },
       .ends = {{kNothing, "false"}}},
      validName("valid", "a1234567", true),
      validName("too long", "a12345678", false),
      validName("of other characters", "a-b", false),
      validName("with a digit first", "1abc", false),
      validName("of a reserved beginning", "SYStem", false),
      validName("reserved", "PUBLIC", false),
      validName("empty", "", false),
      validName("null", nullptr, false),
      format("plain", "cn = John Smith , o = Example ; c=US", R"("CN=JOHN SMITH,O=EXAMPLE,C=US")"),
      format("quoted", R"(cn="a, b" x ; o=x)", R"("CN="A, B";O=X")"),
      format("escaped", R"(cn=a\+b\,c\ )", R"("CN=A+B\,C")"),
      format("of white space", " \n", R"("")"),
      format("empty", "", "null"),
      {.name = "formatDn, null",
       .symbols = {"formatDn"},
       .run = [] { return freed(formatDn(nullptr)); },
       .ends = {{kNothing, "null"}}},
      compare("equal", "cn=a,o=b", "CN = A ; O = B", "true"),
      compare("different", "cn=a", "cn=ab", "false"),
      compare("empty", "cn=a", "", "false"),
      {.name = "compareDns, null",
       .symbols = {"compareDns"},
       .run =
           [] {
             char dn[] = "cn=a";
             return shown(compareDns(dn, nullptr)) + " " + shown(compareDns(nullptr, dn));
           },
       .ends = {{kNothing, "false false"}}},
  };
}

}  // namespace scenarios
