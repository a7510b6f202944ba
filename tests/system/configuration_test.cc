#include "system/Configuration.h"

#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <pwd.h>
#include <unistd.h>

#include <array>
#include <fstream>
#include <sstream>

#include "base/StandardPaths.h"
#include "export/nats/NatsSettings.h"
#include "export/otlp/OtlpSettings.h"
#include "tests/TemporaryDirectory.h"

namespace quarvel {
namespace {

namespace fs = std::filesystem;
using namespace std::chrono_literals;
using testing::ElementsAre, testing::HasSubstr, testing::IsEmpty;

constexpr std::array kBackends{BackendKind{"nats", ReadNatsSettings},
                               BackendKind{"otlp", ReadOtlpSettings}};

template <class Settings>
const Settings& settings(const Configuration& configuration, std::string_view backend) {
  return static_cast<const Settings&>(*configuration.agent.settings.find(backend)->second);
}

class ConfigurationTest : public testing::Test {
 protected:
  Result<Configuration> read(const std::string& text) {
    std::ofstream(file()) << text;
    warnings_.clear();
    return Configuration::read(file(), kBackends, warnings_);
  }
  [[nodiscard]] fs::path file() const { return directory_.path() / "quarvel.toml"; }

  const TemporaryDirectory directory_;
  std::vector<std::string> warnings_;
};

TEST_F(ConfigurationTest, EveryKeyReachesItsPlace) {
  const Result<Configuration> result = read(
      "device = { InternalBuild = true, DeviceClassNumber = 7, Model = 'Marl' }\n"
      "log = { level = 'info' }\n"
      "store = { path = '/data/t.db', sync_ms = 70, max_bytes = 1048576, max_age_days = 3 }\n"
      "analytics = { wanted = ['tarnwick.*', 'other'] }\n"
      "orientation = { source = 'iio' }\n"
      "agent = { backends = ['otlp', 'store'], export = false, drain_rows_per_second = 5, "
      "device = 'car-7', "
      "nats = { urls = ['nats://one:4222', 'tls://two'], stream = 'S', create_stream = true, "
      "replicas = 1, duplicate_window_seconds = 9, credentials = '/c', tls_ca = '/ca', "
      "tls_certificate = '/cert', tls_key = '/key', acknowledge_seconds = 8, gather_seconds = 7 }, "
      "otlp = { endpoint = 'https://three/x', headers = { A = 'Bearer t' }, gzip = false, "
      "tls_ca = '/ca2', connect_seconds = 6, timeout_seconds = 5, gather_seconds = 4 } }\n"
      "tallix = { root = '/sys/tallix', channel = [{ group = 'g', subgroup = 's', name = 'n', "
      "file = '/proc/x', pattern = 'p' }, { group = 'g2', name = 'n2', file = '/proc/y' }] }\n"
      "limits = { message_bytes = 2048, reply_bytes = 4096, frame_seconds = 1, stall_seconds = 2, "
      "depth = 128, queued_calls = 3, queued_bytes = 8192, connections = 4 }\n");
  ASSERT_TRUE(result.ok()) << result.error().description();
  EXPECT_THAT(warnings_, IsEmpty());
  const auto& [device, logLevel, store, agent, wanted, tallix, orientation, limits] =
      result.value();
  using Device = std::remove_cvref_t<decltype(device)>;
  EXPECT_EQ(device, (Device{{"DeviceClassNumber", 7}, {"InternalBuild", true}, {"Model", "Marl"}}));
  EXPECT_EQ(logLevel, LogLevel::info);
  EXPECT_EQ(std::tie(store.path, store.sync, store.maximumBytes, store.maximumAge),
            std::tuple("/data/t.db", 70ms, 1048576U, std::chrono::days(3)));
  EXPECT_THAT(agent.backends, ElementsAre("otlp", "store"));
  EXPECT_EQ(std::tie(agent.exports, agent.drainRowsPerSecond, agent.device),
            std::tuple(false, 5U, "car-7"));
  const auto& nats = settings<NatsSettings>(result.value(), "nats");
  EXPECT_THAT(nats.urls, ElementsAre("nats://one:4222", "tls://two"));
  EXPECT_EQ(std::tie(nats.stream, nats.createStream, nats.replicas, nats.credentials,
                     nats.tls.authority, nats.tls.certificate, nats.tls.key, nats.duplicateWindow,
                     nats.acknowledge, nats.gather),
            std::tuple("S", true, 1, "/c", "/ca", "/cert", "/key", 9s, 8s, 7s));
  const auto& otlp = settings<OtlpSettings>(result.value(), "otlp");
  EXPECT_THAT(otlp.headers, ElementsAre(testing::Pair("A", "Bearer t")));
  EXPECT_EQ(std::tie(otlp.endpoint, otlp.gzip, otlp.tls.authority, otlp.connect, otlp.timeout,
                     otlp.gather),
            std::tuple("https://three/x", false, "/ca2", 6s, 5s, 4s));
  EXPECT_THAT(wanted, ElementsAre("tarnwick.*", "other"));
  EXPECT_EQ(tallix.root, "/sys/tallix");
  ASSERT_EQ(tallix.channels.size(), 2U);
  const Configuration::TallixChannel& channel = tallix.channels[0];
  EXPECT_EQ(std::tie(channel.group, channel.subgroup, channel.name, channel.file, channel.pattern),
            std::tuple("g", "s", "n", "/proc/x", "p"));
  EXPECT_EQ(tallix.channels[1].name, "n2");
  EXPECT_EQ(orientation, Configuration::OrientationSource::iio);
  EXPECT_EQ(std::tie(limits.messageBytes, limits.replyBytes, limits.depth, limits.queuedCalls,
                     limits.queuedBytes, limits.connections, limits.frame, limits.stall),
            std::tuple(2048U, 4096U, 128U, 3U, 8192U, 4U, 1s, 2s));
}

TEST_F(ConfigurationTest, OnlyAnAbsentFileAndAbsentKeysLeaveTheDefaults) {
  for (const char* absent : {"none.toml", "none/quarvel.toml"}) {
    EXPECT_TRUE(Configuration::read(directory_.path() / absent, kBackends, warnings_).ok());
  }
  const Result<Configuration> folder = Configuration::read("/", kBackends, warnings_);
  ASSERT_FALSE(folder.ok());
  EXPECT_THAT(folder.error().description(), HasSubstr("Is a directory"));
  const Result<Configuration> partial = read("[limits]\ndepth = 1\n[agent]\nbackends = []\n");
  ASSERT_TRUE(partial.ok());
  EXPECT_EQ(partial.value().limits.depth, 1U);
  EXPECT_EQ(partial.value().limits.connections, 4096U);
  EXPECT_THAT(partial.value().agent.backends, IsEmpty());
}

TEST_F(ConfigurationTest, WrongValueNamesFileLineKeyAndWhatIsAllowed) {
  const std::pair<const char*, const char*> faults[] = {
      {"[limits]\ndepth = 129", ":2: limits.depth must be an integer from 1 to 128, but is 129."},
      {"[limits]\n\ndepth = 0", ":3: limits.depth must be an integer from 1 to 128, but is 0."},
      {"[store]\nsync_ms = 1.5", "but is the real 1.5."},
      {"[store]\nmax_bytes = 5", "max_bytes must be an integer of at least 1048576, but is 5."},
      {"[store]\npath = 5", ":2: store.path must be a string, a path, but is 5."},
      {"[log]\nlevel = 'loud'",
       "one of \"error\", \"default\", \"info\", \"debug\", but is \"loud\"."},
      {"[agent]\nbackends = 'store'",
       "a list of \"store\", \"nats\", \"otlp\", each at most once, but"},
      {"[agent]\nbackends = [\n'store',\n'kafka']", ":4: agent.backends[1] must be"},
      {"[agent]\nbackends = ['store', 'store']", "each at most once, but is \"store\"."},
      {"[agent]\nexport = 1", ":2: agent.export must be true or false, but is 1."},
      {"[agent]\nnats = 1", ":2: agent.nats must be a table, but is 1."},
      {"[agent]\ndevice = 'a.b'", ":2: agent.device must be a name of letters, digits,"},
      {"[agent.nats]\nurls = ['http://x']", ":2: agent.nats.urls[0] must be"},
      {"[agent.nats]\nurls = []", ":1: agent.nats.urls is missing."},
      {"[agent.nats]\nstream = 'a.b'", ":2: agent.nats.stream must be a name without"},
      {"[agent.nats]\nstream = ''\ncreate_stream = true", ":1: agent.nats.stream is missing."},
      {"[agent.nats]\ntls_certificate = 'c'", ":1: agent.nats.tls_key is missing."},
      {"[agent.otlp]\nendpoint = 'localhost:4318'", ":2: agent.otlp.endpoint must be an address"},
      {"[agent.otlp.headers]\nA = \"b\\nC: d\"", ":2: agent.otlp.headers.A must be a string"},
      {"[agent.otlp.headers]\nA = 1", ":2: agent.otlp.headers.A must be a string"},
      {"[analytics]\nwanted = ['']", ":2: analytics.wanted[0] must be"},
      {"[device]\nA = 2026-01-31", ":2: device.A must be a boolean, an integer or a string"},
      {"\nstore = []", ":2: store must be a table, but is a list."},
      {"[tallix.channel]\nname = 'n'",
       ":1: tallix.channel must be tables, each [[tallix.channel]]"},
      {"[[tallix.channel]]\ngroup = 'g'\nname = 'n'", ":1: tallix.channel.file is missing."},
      {"[orientation]\nsource = 'compass'", ":2: orientation.source must be one of"},
      {"[limits]\ndepth = ", ":2: "},
  };
  for (const auto& [text, said] : faults) {
    const Result<Configuration> result = read(text);
    ASSERT_FALSE(result.ok()) << text;
    EXPECT_EQ(result.error().domain, "quarvel.configuration");
    EXPECT_THAT(result.error().description(),
                testing::AllOf(HasSubstr(file().native() + ":"), HasSubstr(said)));
  }
}

TEST_F(ConfigurationTest, UnknownKeysAreWarningsOnly) {
  const Result<Configuration> result = read(
      "top = 1\n[limits]\ndepht = 5\n[agent.nats]\nurl = 'x'\n[[tallix.channel]]\n"
      "group='g'\nname='n'\nfile='f'\nfiel='f'\n");
  ASSERT_TRUE(result.ok());
  EXPECT_THAT(warnings_,
              testing::UnorderedElementsAre(
                  file().native() + ":1: top is no key of ours.", HasSubstr(":3: limits.depht is"),
                  HasSubstr(":5: agent.nats.url is"), HasSubstr(":10: tallix.channel.fiel is")));
}

TEST(DirectoriesTest, FirstThatAppliesIsTaken) {
  // The variables; then runtime, state and configuration directory, the socket and the prefix.
  const struct {
    bool root;
    const char *variables, *found;
  } cases[] = {
      // A service manager's come first, even for root.
      {true,
       "RUNTIME_DIRECTORY=/r/a:/r/b STATE_DIRECTORY=/s CONFIGURATION_DIRECTORY=/c "
       "XDG_RUNTIME_DIR=/x",
       "/r/a /s /c /r/a/reporting.sock "},
      {true, "XDG_RUNTIME_DIR=/x XDG_STATE_HOME=/x HOME=/root",
       "/run/quarvel /var/lib/quarvel /etc/quarvel /run/quarvel/reporting.sock "},
      {false, "XDG_RUNTIME_DIR=/x/r XDG_STATE_HOME=/x/s XDG_CONFIG_HOME=/x/c",
       "/x/r/quarvel /x/s/quarvel /x/c/quarvel /x/r/quarvel/reporting.sock "},
      // Relative and empty ones are ignored.
      {false,
       "HOME=/home/u XDG_RUNTIME_DIR=/x/r XDG_STATE_HOME=s XDG_CONFIG_HOME= STATE_DIRECTORY=",
       "/x/r/quarvel /home/u/.local/state/quarvel /home/u/.config/quarvel "
       "/x/r/quarvel/reporting.sock "},
      {true, "RUNTIME_DIRECTORY=/r QUARVEL_SOCKET=/tmp/s QUARVEL_DIAGNOSTICS_PREFIX=/tmp/p",
       "/r /var/lib/quarvel /etc/quarvel /tmp/s /tmp/p"},
  };
  for (const auto& each : cases) {
    ::clearenv();
    std::istringstream variables(each.variables);
    for (std::string variable; variables >> variable;) {
      const std::size_t equals = variable.find('=');
      setenv(variable.substr(0, equals).c_str(), variable.substr(equals + 1).c_str(), 1);
    }
    const StandardPaths found = StandardPaths::fromEnvironment(each.root);
    EXPECT_EQ(found.runtime.native() + ' ' + found.state.native() + ' ' +
                  found.configuration.native() + ' ' + found.socket.native() + ' ' +
                  found.diagnosticsPrefix.native(),
              each.found);
  }
  ::clearenv();
  const std::string home = ::getpwuid(::geteuid())->pw_dir;
  const StandardPaths found = StandardPaths::fromEnvironment(false);
  EXPECT_EQ(found.runtime, "/run/user/" + std::to_string(::geteuid()) + "/quarvel");
  EXPECT_EQ(found.state, home + "/.local/state/quarvel");
}

}  // namespace
}  // namespace quarvel
