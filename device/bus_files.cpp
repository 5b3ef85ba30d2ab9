// What the device's bus reads: its configuration, the daemon's policy, how the daemon is started.
#include <glib.h>

#include <filesystem>

#include "bus_policy.h"
#include "device.h"
#include "state/state_file.h"

namespace {

constexpr char kDoctype[] =
    "<!DOCTYPE busconfig PUBLIC \"-//freedesktop//DTD D-BUS Bus Configuration 1.0//EN\"\n"
    " \"http://www.freedesktop.org/standards/dbus/1.0/busconfig.dtd\">\n";

/** What a distribution's system bus allows before the policies of services. */
constexpr char kSystemDefaults[] = R"xml(
  <policy context="default">
    <allow user="*"/>
    <deny own="*"/>
    <deny send_type="method_call"/>
    <allow send_type="signal"/>
    <allow send_requested_reply="true" send_type="method_return"/>
    <allow send_requested_reply="true" send_type="error"/>
    <allow receive_type="method_call"/>
    <allow receive_type="method_return"/>
    <allow receive_type="error"/>
    <allow receive_type="signal"/>
    <allow send_destination="org.freedesktop.DBus" send_interface="org.freedesktop.DBus"/>
    <allow send_destination="org.freedesktop.DBus"
           send_interface="org.freedesktop.DBus.Introspectable"/>
    <allow send_destination="org.freedesktop.DBus"
           send_interface="org.freedesktop.DBus.Properties"/>
    <deny send_destination="org.freedesktop.DBus" send_interface="org.freedesktop.DBus"
          send_member="UpdateActivationEnvironment"/>
  </policy>
  <policy user="root">
    <allow send_destination="org.freedesktop.DBus"
           send_interface="org.freedesktop.DBus.Monitoring"/>
  </policy>
  <limit name="max_replies_per_connection">50000</limit>
  <limit name="max_match_rules_per_connection">50000</limit>
)xml";

std::string xml_text(const std::string &text) {
  const embedded::GText escaped(g_markup_escape_text(text.c_str(), -1));
  return escaped.get();
}

std::string shell_text(const std::string &text) {
  const embedded::GText quoted(g_shell_quote(text.c_str()));
  return quoted.get();
}

}  // namespace

std::string write_bus_files(const std::string &device) {
  std::error_code error;
  std::filesystem::create_directories(device + "/run/services", error);
  const std::string program = program_directory() + "/quarn-device";
  write_file(device + "/run/services/" + kBusName + ".service",
             std::string("[D-BUS Service]\nName=") + kBusName + "\nExec=" + shell_text(program) +
                 " daemon " + shell_text(device) + "\n");
  const std::string policy = device + "/run/" + kBusName + ".conf";
  write_file(policy, kShippedPolicy);
  std::string config = device + "/run/bus.conf";
  write_file(config, std::string(kDoctype) + "<busconfig>\n  <listen>" +
                         xml_text(bus_address(device)) +
                         "</listen>\n  <auth>EXTERNAL</auth>\n  <servicedir>" + xml_text(device) +
                         "/run/services</servicedir>" + kSystemDefaults + "  <include>" +
                         xml_text(policy) + "</include>\n</busconfig>\n");
  return config;
}
