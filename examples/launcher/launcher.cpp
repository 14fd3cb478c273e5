// An LDAP server of the install root that VRA_LDAP_HOME names. It is for root, because the port of the server is in
// /etc/services.
//
//     launcher start USER    gives the server a free port, and starts it with sbin/64/vrarun as that user
//     launcher ask NAME...   asks the server for these entries, and compares the names that it answers with
//     launcher stop          stops the server, and removes it from /etc/services
#include <ldap.h>

#include <chrono>
#include <fstream>
#include <iostream>
#include <memory>
#include <osutils.hpp>
#include <stdexcept>
#include <string>
#include <system_error>
#include <thread>

using VRAOSUtils::EtcServices;

namespace {

constexpr char kService[] = "vraslapd";
constexpr char kProgram[] = "slapd";

void require(int code, const std::string& what) {
  if (const std::error_code error = osutils::errorCode(code)) throw std::system_error(error, what);
}

void readServices(EtcServices& services) {
  require(services.readEtcServices(), EtcServices::ETC_SERVICES_FILE);
}

std::string folderOf(const char* name) { return osutils::getVRAInstallPath().value() + "/" + name; }

std::string pidFile() { return folderOf("var/slapd.pid"); }

// The server's process id, or an empty text. stopProcess() takes what is not a number of a process for a group of
// processes.
std::string runningServer() {
  int pid = 0;
  std::ifstream(pidFile()) >> pid;
  const std::string text = std::to_string(pid);
  return pid > 1 && isProcessStarted(text.c_str(), kProgram) ? text : "";
}

int start(std::string user) {
  if (!isValidName(user.data())) throw std::runtime_error("not a valid name: " + user);
  std::string var = folderOf("var");
  if (!isDirectory(var.c_str()) && !createDirectory(var.data(), user.data(), nullptr, 0700))
    throw std::runtime_error("cannot make " + var + " for " + user);

  EtcServices services;
  readServices(services);
  const int port = services.findAvaliablePort(EtcServices::INIT_PORT_INDEX);
  require(services.addService(kService, port), kService);
  const std::string arguments = std::to_string(port) + " " + user;
  const int status = startProcess(folderOf("sbin/64").c_str(), arguments.c_str());
  const std::string pid = runningServer();
  if (status != 0 || pid.empty()) {
    require(services.deleteService(kService), kService);
    throw std::runtime_error("slapd does not start: status " + std::to_string(status));
  }
  std::cout << kService << ": port " << port << ", process " << pid << '\n';
  return 0;
}

struct Unbind {
  void operator()(LDAP* server) const { (void)ldap_unbind_ext_s(server, nullptr, nullptr); }
};
using Server = std::unique_ptr<LDAP, Unbind>;

Server connect() {
  EtcServices services;
  readServices(services);
  const int port = services.getServicePort(kService);
  if (port < 0) throw std::runtime_error(std::string(kService) + " is not in the services file");
  const std::string address = "ldap://127.0.0.1:" + std::to_string(port);
  LDAP* server = nullptr;
  if (const int code = ldap_initialize(&server, address.c_str()); code != LDAP_SUCCESS)
    throw std::runtime_error(address + ": " + ldap_err2string(code));
  const int version = LDAP_VERSION3;
  (void)ldap_set_option(server, LDAP_OPT_PROTOCOL_VERSION, &version);
  return Server(server);
}

// The name that the server has for that entry.
std::string answerFor(LDAP* server, const std::string& name) {
  char no_attributes[] = LDAP_NO_ATTRS;
  char* attributes[] = {no_attributes, nullptr};
  timeval limit{10, 0};
  LDAPMessage* found = nullptr;
  const int code = ldap_search_ext_s(server, name.c_str(), LDAP_SCOPE_BASE, nullptr, attributes, 0,
                                     nullptr, nullptr, &limit, 1, &found);
  const std::unique_ptr<LDAPMessage, decltype(&ldap_msgfree)> result(found, ldap_msgfree);
  LDAPMessage* const entry = code == LDAP_SUCCESS ? ldap_first_entry(server, found) : nullptr;
  if (entry == nullptr) throw std::runtime_error(name + ": " + ldap_err2string(code));
  const std::unique_ptr<char, decltype(&ldap_memfree)> answer(ldap_get_dn(server, entry),
                                                              ldap_memfree);
  return answer ? answer.get() : "";
}

int ask(char** names) {
  const Server server = connect();
  bool are_equal = true;
  for (char** name = names; *name != nullptr; ++name) {
    std::string answer = answerFor(server.get(), *name);
    if (compareDns(*name, answer.data())) {
      std::cout << "equal\t" << osutils::formatDn(answer).value() << '\n';
    } else {
      std::cout << "other\t" << answer << '\n';
      are_equal = false;
    }
  }
  return are_equal ? 0 : 1;
}

int stop() {
  const std::string pid = runningServer();
  if (!pid.empty() && stopProcess(pid.c_str()) != 0)
    throw std::runtime_error("cannot stop process " + pid);
  for (int tries = 100; !runningServer().empty(); --tries) {
    if (tries == 0) throw std::runtime_error("slapd does not end: process " + pid);
    std::this_thread::sleep_for(std::chrono::milliseconds(50));
  }
  std::string file = pidFile();
  (void)deleteFile(file.data());  // slapd had no time to remove it
  EtcServices services;
  readServices(services);
  require(services.deleteService(kService), kService);
  std::cout << kService << (pid.empty() ? ": did not run, removed\n" : ": stopped, removed\n");
  return 0;
}

}  // namespace

int main(int argc, char** argv) {
  const std::string command = argc > 1 ? argv[1] : "";
  try {
    if (command == "start" && argc == 3) return start(argv[2]);
    if (command == "ask" && argc > 2) return ask(argv + 2);
    if (command == "stop" && argc == 2) return stop();
  } catch (const std::exception& failure) {
    std::cerr << "launcher: " << failure.what() << '\n';
    return 1;
  }
  std::cerr << "usage: launcher start USER | ask NAME... | stop\n";
  return 2;
}
