// Orientation end to end: an internal-build daemon follows iio-sensor-proxy (python3-dbusmock's
// template on a private system bus) and the UI orientation posted with `qnreport`.
#include <stdlib.h>

#include <systemd/sd-bus.h>

#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

#include "tests/e2e/Daemon.h"

namespace qn::e2e {
namespace {

using ::testing::ElementsAre;
using ::testing::IsEmpty;
using ::testing::SizeIs;

constexpr const char* kSensorProxy = "net.hadess.SensorProxy";

// A private dbus-daemon with a system-bus configuration under `dir`, its address in
// DBUS_SYSTEM_BUS_ADDRESS for the processes started while it runs, and a client of it.
class SystemBus {
 public:
  explicit SystemBus(const testing::TempDir& dir) : address_("unix:path=" + dir.File("bus")) {
    std::filesystem::create_directories(dir.File("dbus"));
    std::ofstream(dir.File("bus.conf"))
        << "<busconfig><type>system</type><listen>" << address_
        << "</listen><auth>EXTERNAL</auth><policy context=\"default\"><allow user=\"*\"/>"
           "<allow own=\"*\"/><allow send_destination=\"*\"/><allow receive_sender=\"*\"/>"
           "</policy></busconfig>\n";
    daemon_ = std::make_unique<ChildProcess>(
        "/usr/bin/dbus-daemon",
        std::vector<std::string>{"--config-file=" + dir.File("bus.conf"), "--nofork",
                                 "--nopidfile"},
        dir.File("dbus"));
    setenv("DBUS_SYSTEM_BUS_ADDRESS", address_.c_str(), 1);
    EXPECT_TRUE(Eventually([&] { return sd_bus_open_system(&bus_) >= 0; })) << daemon_->Stderr();
  }
  ~SystemBus() {
    unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
    sd_bus_message_unref(reply_);
    sd_bus_flush_close_unref(bus_);
  }

  // Starts the iio-sensor-proxy template and waits until it answers.
  std::unique_ptr<ChildProcess> StartSensorProxy(const testing::TempDir& dir,
                                                 bool has_accelerometer) {
    std::filesystem::create_directories(dir.File("mock"));
    auto mock = std::make_unique<ChildProcess>(
        "/usr/bin/python3",
        std::vector<std::string>{
            "-m", "dbusmock", "--system", "--template", "iio-sensors-proxy", "-p",
            std::string("{\"has_accelerometer\": ") + (has_accelerometer ? "true" : "false") + "}"},
        dir.File("mock"));
    EXPECT_TRUE(Eventually([&] {
      return Mock("GetInternalProperty", "s", "HasAccelerometer") >= 0;
    })) << mock->Stderr();
    return mock;
  }

  // Drives an accelerometer change through the template.
  void SetOrientation(const char* text) {
    EXPECT_GE(
        Mock("SetInternalProperty", "ssv", kSensorProxy, "AccelerometerOrientation", "s", text), 0);
  }

  // The connections that hold the accelerometer, as the template records them.
  std::vector<std::string> Claims() {
    std::vector<std::string> out;
    if (Mock("GetInternalProperty", "s", "AccelerometerOwners") < 0 ||
        sd_bus_message_enter_container(reply_, 'a', "s") < 0) {
      return {"(the template did not answer)"};
    }
    for (const char* name = nullptr; sd_bus_message_read(reply_, "s", &name) > 0;) {
      out.emplace_back(name);
    }
    return out;
  }

 private:
  template <typename... Args>
  int Mock(const char* method, const char* types, Args... args) {
    reply_ = sd_bus_message_unref(reply_);
    return sd_bus_call_method(bus_, kSensorProxy, "/net/hadess/SensorProxy",
                              "org.freedesktop.DBus.Mock", method, nullptr, &reply_, types,
                              args...);
  }

  const std::string address_;
  std::unique_ptr<ChildProcess> daemon_;
  sd_bus* bus_ = nullptr;
  sd_bus_message* reply_ = nullptr;  // the last reply, freed with the next call's
};

// Runs `qnreport --home HOME ARGS...` to its end; its stdout, or "exit N" when it failed.
std::string Qnreport(const Daemon& daemon, std::vector<std::string> args) {
  args.insert(args.begin(), {"--home", daemon.home()});
  testing::TempDir out;
  ChildProcess tool(QN_QNREPORT_PATH, args, out.path());
  const auto status = tool.Wait();
  return status == Exited(0) ? tool.Stdout() : "exit " + std::to_string(status ? status->code : -1);
}

bool Logged(Daemon& daemon, const std::string& text) {
  return Eventually([&] { return daemon.process().Stderr().find(text) != std::string::npos; });
}

// A summary event's field ("(missing)" when it has none).
std::string Field(const Value& summary, const char* key) {
  const Dictionary* d = summary.as_dictionary();
  const Value* value = d ? d->Find(key) : nullptr;
  const std::string* text = value ? value->as_string() : nullptr;
  return text ? *text : "(missing)";
}

std::vector<double> Numbers(const std::string& joined) {
  std::vector<double> out;
  std::istringstream in(joined);
  for (std::string part; std::getline(in, part, ',');) out.push_back(std::stod(part));
  return out;
}

// Two accelerometer changes and one posted UI orientation during a telephony session reach
// its summary event in order (a UI orientation that is no orientation name does not), and
// the accelerometer is held only while the session runs.
TEST(OrientationTest, ChangesReachTheSummaryAndTheClaimEndsWithTheSession) {
  testing::TempDir dir, home;
  SystemBus bus(dir);
  auto sensors = bus.StartSensorProxy(dir, true);
  auto daemon = StartOn(home, {"--internal-build", "--debug", "qnrr"});
  auto client = daemon->Connect();
  ASSERT_TRUE(client);
  EXPECT_EQ(client->createReportingSessionSync(42), true);
  EXPECT_EQ(client->setServiceTypeSync(2, 42), true);
  client->startReportingSessionForID(42, [](bool) {});
  ASSERT_TRUE(Eventually([&] { return bus.Claims().size() == 1; }));

  bus.SetOrientation("normal");
  ASSERT_TRUE(Logged(*daemon, "mode=device orientation=\"normal\""));
  std::this_thread::sleep_for(20ms);  // so that the two changes' times differ
  bus.SetOrientation("left-up");
  ASSERT_TRUE(Logged(*daemon, "mode=device orientation=\"left-up\""));
  EXPECT_EQ(Qnreport(*daemon, {"orientation", "ui", "sideways"}), "exit 1");
  std::ofstream(home.File("run/notify/com.norvel.quenta.orientation.ui")) << "sideways\n";
  ASSERT_TRUE(Logged(*daemon, "ignored a UI orientation that is not"));
  EXPECT_EQ(Qnreport(*daemon, {"orientation", "ui", "right-up"}), "");
  ASSERT_TRUE(Logged(*daemon, "mode=ui orientation=\"right-up\""));
  EXPECT_EQ(Qnreport(*daemon, {"orientation"}), "device: left-up\nui: right-up\n");

  bool stopped = false;
  client->stopReportingSessionForID(42, [&](bool ok) { stopped = ok; });
  ASSERT_TRUE(client->WaitForReplies());
  EXPECT_TRUE(stopped);
  EXPECT_TRUE(Eventually([&] { return bus.Claims().empty(); })) << "released at the stop";
  EXPECT_EQ(Qnreport(*daemon, {"orientation"}), "device: none\nui: right-up\n");

  client.reset();
  EXPECT_EQ(daemon->Stop(), Exited(0));
  std::vector<Value> summaries;
  for (const auto& row : RowsOf(daemon->Rows(), ReportingStoreRow::Table::kLivoMessage)) {
    if (row.payload.find("QN_Session_Summary_Event") != std::string::npos) {
      summaries.push_back(Json(row.payload));
    }
  }
  ASSERT_THAT(summaries, SizeIs(1));
  EXPECT_EQ(Field(summaries[0], "device_orientation"), "normal,left-up");
  const auto times = Numbers(Field(summaries[0], "device_orientation_time"));
  ASSERT_THAT(times, SizeIs(2));
  EXPECT_LT(0, times[0]);
  EXPECT_LT(times[0], times[1]);
  EXPECT_EQ(Field(summaries[0], "ui_orientation"), "right-up");
  EXPECT_THAT(Numbers(Field(summaries[0], "ui_orientation_time")), SizeIs(1));
}

// Without an accelerometer, a sensor service or a bus, sessions start and stop as always and
// one line says why at the first of them; nothing is claimed.
TEST(OrientationTest, WithoutASensorSessionsRunAndOneLineSaysWhy) {
  const struct {
    const char* name;
    bool bus, service;
    const char* reason;
  } cases[] = {
      {"no accelerometer", true, true, "the device has no accelerometer"},
      {"no service", true, false, "iio-sensor-proxy is not on the system bus"},
      {"no bus", false, false, "the system bus is not available"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    testing::TempDir dir, home;
    std::optional<SystemBus> bus;
    if (c.bus) bus.emplace(dir);
    auto sensors = c.service ? bus->StartSensorProxy(dir, false) : nullptr;
    if (!c.bus) setenv("DBUS_SYSTEM_BUS_ADDRESS", ("unix:path=" + dir.File("none")).c_str(), 1);
    auto daemon = StartOn(home, {"--internal-build"});
    auto client = daemon->Connect();
    ASSERT_TRUE(client);
    EXPECT_EQ(client->createReportingSessionSync(42), true);
    EXPECT_EQ(client->setServiceTypeSync(2, 42), true);
    std::vector<bool> replies;
    for (int round = 0; round < 2; ++round) {
      client->startReportingSessionForID(42, [&](bool ok) { replies.push_back(ok); });
      client->stopReportingSessionForID(42, [&](bool ok) { replies.push_back(ok); });
      ASSERT_TRUE(client->WaitForReplies());
    }
    EXPECT_THAT(replies, ElementsAre(true, true, true, true));
    const std::string line = std::string("device orientation is not reported: ") + c.reason;
    EXPECT_TRUE(Logged(*daemon, line));
    client.reset();
    EXPECT_EQ(daemon->Stop(), Exited(0));
    unsetenv("DBUS_SYSTEM_BUS_ADDRESS");
    const std::string log = daemon->process().Stderr();
    EXPECT_EQ(log.find(line), log.rfind(line)) << "said once";
    if (sensors) {
      EXPECT_THAT(bus->Claims(), IsEmpty());
    }
  }
}

// iio-sensor-proxy that starts while a session runs is claimed then, and released at the stop.
TEST(OrientationTest, SensorServiceStartingLaterIsClaimed) {
  testing::TempDir dir, home;
  SystemBus bus(dir);
  auto daemon = StartOn(home, {"--internal-build"});
  auto client = daemon->Connect();
  ASSERT_TRUE(client);
  EXPECT_EQ(client->createReportingSessionSync(42), true);
  EXPECT_EQ(client->setServiceTypeSync(2, 42), true);
  client->startReportingSessionForID(42, [](bool) {});
  ASSERT_TRUE(Logged(*daemon, "iio-sensor-proxy is not on the system bus"))
      << daemon->process().Stderr();
  auto sensors = bus.StartSensorProxy(dir, true);
  EXPECT_TRUE(Eventually([&] { return bus.Claims().size() == 1; }));
  client->stopReportingSessionForID(42, [](bool) {});
  ASSERT_TRUE(client->WaitForReplies());
  EXPECT_TRUE(Eventually([&] { return bus.Claims().empty(); }));
}

}  // namespace
}  // namespace qn::e2e
