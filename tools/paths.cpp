// The paths and db commands: the paths of the installation and of its database.
#include <memory>

#include "command.h"

namespace paths {
namespace {

constexpr const char* kSchemaVersion = "6.1";

struct Options {
  std::optional<std::string> schema_version;
  std::optional<std::string> instance;
  std::optional<std::string> location;
  std::optional<std::string> migration;
};

Answer paths(Options& options) {
  Answer list = Answer::array();
  const auto add = [&list](const char* name, const std::string& path, bool exists) {
    list.push_back({{"name", name}, {"path", path}, {"exists", exists}});
  };
  const auto addPath = [&add](const char* name, const std::string& path) {
    add(name, path, doesFileExist(path.c_str()));
  };
  addPath("install", installedPath(osutils::getVRAInstallPath()));
  addPath("lib", installedPath(osutils::getVRAInstallLibPath()));
  addPath("sbin", installedPath(osutils::getVRAInstallSbinPath()));
  addPath("launcher", installedPath(osutils::getVRAVrarunFilePath()));
  addPath("schema", installedPath(osutils::getVRABaseSchemaDirPath(
                        options.schema_version.value_or(kSchemaVersion).c_str())));
  addPath("var", orNoMemory(osutils::getVRAVarBasePath()));
  addPath("admin log", orNoMemory(osutils::getAdminLogsPath(ADMIN_LOG_ADM)));
  addPath("database log", orNoMemory(osutils::getAdminLogsPath(ADMIN_LOG_XQ4)));
  addPath("database commands log", orNoMemory(osutils::getAdminLogsPath(ADMIN_LOG_XQ4_CMDS)));
  const std::string component = installedPath(osutils::getVRAInstallPath()) + rdbm_lib;
  const bool is_installed = isRDBMComponentInstalled();
  // The library also returns false without memory.
  if (!is_installed && doesFileExist(component.c_str())) throw std::bad_alloc();
  add("database component", component, is_installed);
  return list;
}

// The file that the library reads with these options.
std::string propertiesFile(const Options& options) {
  if (options.migration) return *options.migration + "/etc/xq4info";
  if (options.instance) {
    return *options.location + "/vraslapd-" + *options.instance + "/etc/ldapdb.properties";
  }
  return installedPath(osutils::getVRAInstallPath()) + "/etc/ldapdb.properties";
}

Answer database(Options& options) {
  if (options.migration) {
    g_isCallerVraImigr = 1;
    g_migBackDir = options.migration->c_str();
  } else if (options.instance) {
    g_loadLocalXQ4Path = 1;
    g_dirInstName = options.instance->c_str();
    g_dirInstLocation = options.location->c_str();
  }
  std::string version;
  const std::optional<std::string> path = osutils::getXQ4PathAndVersion(&version);
  if (!path) {
    const std::string file = propertiesFile(options);
    const std::string what = "no database path and version found in " + file;
    if (checkFilePerms(file.c_str()) == OSUTILS_SUCCESS)
      throw Failure(OSUTILS_NO_SUCH_OBJECT, what);
    throw Failure(what, file);
  }
  return {{"path", *path}, {"version", version}};
}

}  // namespace

void addCommands(Tool& tool) {
  const auto options = std::make_shared<Options>();

  Command& layout = tool.command(tool.all(), "paths",
                                 "Show the paths of the installation, and which of them exist",
                                 bound(options, paths));
  tool.option(layout, "--schema", "VERSION", options->schema_version,
              std::string("The schema version whose directory is shown, ") + kSchemaVersion +
                  " by default");

  Command& db =
      tool.command(tool.all(), "db",
                   "Show the path and version of the database, from the product's\n"
                   "properties file by default. An invalid version is reported in a line\n"
                   "of its own",
                   bound(options, database));
  Option& instance = tool.option(db, "--instance", "NAME", options->instance,
                                 "Read the file of this server instance instead");
  Option& location =
      tool.option(db, "--location", "DIR", options->location,
                  "The directory that contains the instance's home directory", kDirectory);
  Option& migration = tool.option(db, "--migration", "DIR", options->migration,
                                  "Read the backup of the migration tool instead", kDirectory);
  instance.needs(&location);
  location.needs(&instance);
  migration.excludes(&instance)->excludes(&location);
}

}  // namespace paths
