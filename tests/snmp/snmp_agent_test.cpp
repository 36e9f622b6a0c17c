/* The real Net-SNMP library serviced by the select loop: an in-process
 * master agent on a loopback UDP port answers snmpget, and an SNMP alarm
 * fires, with SelSelect as the only loop. No system configuration, MIB or
 * persistent file is read or written. */
#include <net-snmp/net-snmp-config.h>
#include <net-snmp/net-snmp-includes.h>
#include <net-snmp/agent/net-snmp-agent-includes.h>

#include <cstdlib>
#include <filesystem>

#include "selector/sel.h"
#include "support/test_support.h"

namespace {

struct Client {
    std::string text;
    bool closed = false;
};
int collect_output(int fd, unsigned, void *arg, SelFdEntry *) {
    auto *client = static_cast<Client *>(arg);
    char buf[512];
    const ssize_t n = read(fd, buf, sizeof buf);
    if (n > 0) return client->text.append(buf, static_cast<size_t>(n)), 0;
    client->closed = true;
    return SelRemFD(fd), 0;
}

int alarms = 0;

} // namespace

TEST(NetSnmpAgent, SnmpgetReadsTheScalarAndAnAlarmFiresThroughSelSelect) {
    char dir[] = "/tmp/qorbu-snmp-XXXXXX";
    ASSERT_NE(mkdtemp(dir), nullptr);
    const int port =
        ntohs(qorbu::test::Listener(0, false, SOCK_DGRAM).addr.sin_port); /* free once it closes */
    for (const char *name : {"SNMPCONFPATH", "SNMP_PERSISTENT_DIR", "HOME"}) setenv(name, dir, 1);
    setenv("MIBS", "", 1), setenv("MIBDIRS", "", 1);
    for (int option : {NETSNMP_DS_LIB_DONT_READ_CONFIGS, NETSNMP_DS_LIB_DISABLE_PERSISTENT_LOAD,
                       NETSNMP_DS_LIB_DISABLE_PERSISTENT_SAVE, NETSNMP_DS_LIB_ALARM_DONT_USE_SIG})
        netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, option, 1);
    netsnmp_ds_set_string(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_PERSISTENT_DIR, dir);
    const std::string agent = "udp:127.0.0.1:" + std::to_string(port);
    netsnmp_ds_set_string(NETSNMP_DS_APPLICATION_ID, NETSNMP_DS_AGENT_PORTS, agent.c_str());
    snmp_enable_stderrlog();
    ASSERT_EQ(init_agent("qorbu-snmp-test"), 0);
    const oid scalar_oid[] = {1, 3, 6, 1, 4, 1, 99999, 1, 0};
    int scalar = 4242;
    ASSERT_EQ(
        netsnmp_register_int_instance("qorbuScalar", scalar_oid, OID_LENGTH(scalar_oid), &scalar, nullptr),
        MIB_REGISTERED_OK);
    netsnmp_config_remember(const_cast<char *>("rocommunity public 127.0.0.1"));
    init_snmp("qorbu-snmp-test");
    ASSERT_EQ(init_master_agent(), 0);
    ASSERT_EQ(SelInit(), 0);
    ASSERT_NE(snmp_alarm_register(
                  1, 0, [](unsigned, void *) { ++alarms; }, nullptr),
              0u);

    const std::string command =
        std::string(QORBU_SNMPGET) + " -v2c -c public -On -t 5 -r 2 " + agent + " .1.3.6.1.4.1.99999.1.0";
    FILE *snmpget = popen(command.c_str(), "r");
    ASSERT_NE(snmpget, nullptr);
    Client client;
    ASSERT_EQ(SelAddFD(fileno(snmpget), SEL_READ, 0, collect_output, &client), 0);
    for (const double start = qorbu::test::seconds_now();
         (!client.closed || alarms == 0) && qorbu::test::seconds_now() - start < 60;)
        SelSelect();
    const int status = pclose(snmpget);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << client.text;
    EXPECT_NE(client.text.find(".1.3.6.1.4.1.99999.1.0 = INTEGER: 4242"), std::string::npos) << client.text;
    EXPECT_GE(alarms, 1);
    snmp_shutdown("qorbu-snmp-test");
    std::filesystem::remove_all(dir);
}
