/* The real Net-SNMP library serviced by the select loop: an in-process
 * master agent on a loopback UDP port answers snmpget, and an SNMP alarm
 * fires, with SelSelect as the only loop. No system configuration, MIB or
 * persistent file is read or written. */
#include <net-snmp/net-snmp-config.h>
#include <net-snmp/net-snmp-includes.h>
#include <net-snmp/agent/net-snmp-agent-includes.h>

#include <cstdlib>
#include <string>

#include "selector/sel.h"
#include "support/test_support.h"

namespace {

constexpr const char *kAppName = "qorbu-snmp-test";
constexpr int kScalarValue = 4242;
constexpr double kGiveUpAfterSec = 120.0;
const oid kScalarOid[] = {1, 3, 6, 1, 4, 1, 99999, 1, 0}; /* the instance itself */
constexpr const char *kScalarOidText = ".1.3.6.1.4.1.99999.1.0";

int free_udp_port() {
    const int s = socket(AF_INET, SOCK_DGRAM, 0);
    sockaddr_in addr{};
    addr.sin_family = AF_INET;
    addr.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    socklen_t len = sizeof addr;
    const bool bound = bind(s, reinterpret_cast<sockaddr *>(&addr), sizeof addr) == 0 &&
                       getsockname(s, reinterpret_cast<sockaddr *>(&addr), &len) == 0;
    close(s);
    return bound ? ntohs(addr.sin_port) : -1;
}

struct ClientOutput {
    std::string text;
    bool closed = false;
};

int collect_output(int fd, unsigned, void *arg, SelFdEntry *) {
    auto *out = static_cast<ClientOutput *>(arg);
    char buf[512];
    const ssize_t n = read(fd, buf, sizeof buf);
    if (n > 0) return out->text.append(buf, static_cast<size_t>(n)), 0;
    out->closed = true;
    return SelRemFD(fd), 0;
}

int g_alarms = 0;
void on_alarm(unsigned int, void *) { ++g_alarms; }

class NetSnmpAgent : public ::testing::Test {
  protected:
    void SetUp() override {
        ASSERT_NE(mkdtemp(dir), nullptr);
        port = free_udp_port();
        ASSERT_GT(port, 0);
        setenv("MIBS", "", 1);
        setenv("MIBDIRS", "", 1);
        setenv("SNMPCONFPATH", dir, 1);
        setenv("SNMP_PERSISTENT_DIR", dir, 1);
        setenv("HOME", dir, 1);

        netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_DONT_READ_CONFIGS, 1);
        netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_DISABLE_PERSISTENT_LOAD, 1);
        netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_DISABLE_PERSISTENT_SAVE, 1);
        netsnmp_ds_set_boolean(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_ALARM_DONT_USE_SIG, 1);
        netsnmp_ds_set_string(NETSNMP_DS_LIBRARY_ID, NETSNMP_DS_LIB_PERSISTENT_DIR, dir);
        const std::string address = "udp:127.0.0.1:" + std::to_string(port);
        netsnmp_ds_set_string(NETSNMP_DS_APPLICATION_ID, NETSNMP_DS_AGENT_PORTS, address.c_str());
        snmp_enable_stderrlog();

        ASSERT_EQ(init_agent(kAppName), 0);
        ASSERT_EQ(netsnmp_register_int_instance("qorbuScalar", kScalarOid, OID_LENGTH(kScalarOid), &scalar,
                                                nullptr),
                  MIB_REGISTERED_OK);
        netsnmp_config_remember(const_cast<char *>("rocommunity public 127.0.0.1"));
        init_snmp(kAppName);
        ASSERT_EQ(init_master_agent(), 0);
        ASSERT_EQ(SelInit(), 0);
    }
    void TearDown() override {
        snmp_shutdown(kAppName);
        std::string cleanup = std::string("rm -rf '") + dir + "'";
        (void)!system(cleanup.c_str());
    }

    char dir[32] = "/tmp/qorbu-snmp-XXXXXX";
    int port = 0;
    int scalar = kScalarValue;
};

} // namespace

TEST_F(NetSnmpAgent, SnmpgetReadsTheScalarAndAnAlarmFiresThroughSelSelect) {
    g_alarms = 0;
    ASSERT_NE(snmp_alarm_register(1, 0, on_alarm, nullptr), 0u);

    const std::string command = std::string(QORBU_SNMPGET) +
                                " -v2c -c public -On -t 5 -r 2 udp:127.0.0.1:" + std::to_string(port) + " " +
                                kScalarOidText;
    FILE *client = popen(command.c_str(), "r");
    ASSERT_NE(client, nullptr);
    ClientOutput output;
    ASSERT_EQ(SelAddFD(fileno(client), SEL_READ, 0, collect_output, &output), 0);

    const double start = qorbu::test::seconds_now();
    while ((!output.closed || g_alarms == 0) && qorbu::test::seconds_now() - start < kGiveUpAfterSec)
        SelSelect();
    const int status = pclose(client);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << output.text;
    EXPECT_NE(output.text.find(std::string(kScalarOidText) + " = INTEGER: " + std::to_string(kScalarValue)),
              std::string::npos)
        << output.text;
    EXPECT_GE(g_alarms, 1);
}
