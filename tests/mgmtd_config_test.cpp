// mgmtd's configuration file: which values are valid, what is written, and what a start does with the file.
#include <fstream>

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include "tests/support/mgmtd_fixture.h"

namespace {

TEST(ConfigFile, EachBadLineIsReportedWithItsReason) {
    // In the section of the group, which is line 1, unless there is another; "G" is the group.
    const auto check = [](const std::string &content, const std::string &wanted) {
        std::string error = "F:" + wanted + "\n";
        if (const size_t at = error.find(": G"); at != std::string::npos)
            error.replace(at + 2, 1, GROUP);
        config_text text;
        EXPECT_FALSE(config_parse((contains(content, "[") ? "" : "[" + GROUP + "]\n") + content, "F", &text));
        EXPECT_EQ(text.errors, error) << content;
    };
    check("[/qv/wccpd/wccp/srv_grp/config/256]\n", "1: \"256\" is not a number between 0 and 255");
    check("[/qv/nobody]\n", "1: nothing can be set below /qv/nobody");
    check("/x = 1\n[", "1: /x: there is no such node in the configuration\nF:2: a section is [/name]");
    check("weight = 1\n[/logging]\n", "1: \"weight\" is not a name from the root, and it is in no section");
    check("weight\n", "2: expected [section] or name = value");
    check("\n# c\nweight = 65536\n", "4: G/weight: \"65536\" is not between 0 and 65535");
    check("encap = GRE\n", "2: G/encap: \"GRE\" is not one of gre|l2|either");
    check("protocol = htp\n",
          "2: G/protocol: \"htp\" is not a protocol; give a name such as tcp or udp, or a "
          "number from 1 to 255");
    check("interface = a-name-too-long1\n",
          "2: G/interface: \"a-name-too-long1\" is longer than 15 characters");
    check("weight = 1\nweight = 2\n", "3: G/weight: was given in line 2 already");
    check("interface = \"eth0\n", "2: G/interface: the closing quote is missing");
    check("password = 123456789\n", "2: G/password: the password is longer than 8 characters");
    check("/logging/syslog/facility/system = 7\n",
          "2: /logging/syslog/facility/system: \"7\" is not a log facility (a multiple of 8 up to 184)");
    check("/logging/syslog/process/a /log_level = debug\n",
          "2: /logging/syslog/process/a /log_level: the part \"a \" of the name begins or ends with a blank; "
          "write it without");
    check("[" NODE_BYPASS_CONFIG "/10.0.0.0\\/08]\n",
          "1: \"10.0.0.0/08\" is no IPv4 prefix such as 10.0.0.0/8");
    check("[" NODE_BYPASS_CONFIG "/10.0.0.1\\/8]\n",
          "1: \"10.0.0.1/8\" has host bits that are not zero; write the address of the network, such as "
          "10.0.0.0/8, or /32 for a host");
    check("[" NODE_ACCEPT_CONFIG "/10.0.0]\n", "1: \"10.0.0\" is no IPv4 address such as 10.0.0.1");
    check("[" NODE_ACCEPT_CONFIG "/224.0.0.1]\n", "1: \"224.0.0.1\" is not the address of another host");
    // Errors of the configuration as a whole.
    check("[" NODE_INTERCEPT_CONFIG "/0]\ncheck = http\n",
          "2: " NODE_INTERCEPT_CONFIG "/0/check: http needs the path of a page, without blanks, in "
          "check_argument");
    check("[" + GROUP + "/router/1]\n", "1: G/router/1: has no ipaddr");
    check("router/1/ipaddr = 10.0.0.1\nrouter/3/ipaddr = 10.0.0.3\n",
          "3: G/router: entries are numbered from 1 without a gap, number 2 is missing");
    check("router/1/ipaddr = 10.0.0.1\nrouter/2/ipaddr = 10.0.0.1\nweight = 3\n",
          "3: G/router/2/ipaddr: 10.0.0.1 is given twice");
    check("mask_src_ip = 0xff\nmask_dst_ip = 0\n",
          "3: G: the four masks have 8 bits set together, the most is 7");
}

TEST(Schema, ListsAreCheckedAndMadeCanonical) {
    const auto check = [](const char *node, const std::string &text, const std::string &wanted,
                          const char *refused = "") { // a piece of the reason
        const node_name name = named(std::string(NODE_INTERCEPT_CONFIG "/51/") + node);
        std::string kept, reason;
        const bool valid = check_value(*find_schema_row(name), name, text, &kept, &reason);
        EXPECT_EQ(valid, !*refused) << text;
        EXPECT_EQ(valid ? kept : "", wanted) << text;
        EXPECT_TRUE(contains(reason, refused));
    };
    std::string crowd;
    for (int i = 1; i <= 65; i++)
        crowd += std::to_string(2 * i) + " ";
    check("ports", " 443 80  8080-8090 8085-8100 81", "80-81 443 8080-8100");
    check("ports", "all", "all");
    for (const char *bad : {"all 80", "0", "80-65536"})
        check("ports", bad, "", "is not a list of ports");
    check("ports", "81-80", "", "is greater than its last");
    check("ports", crowd, "", "more than 64 ranges");
    check("ports", crowd + "1-1000", "1-1000");
    check("bypass", "192.0.2.1 10.0.0.0/8 10.2.0.0/16 9.0.0.0/8 10.0.0.0/8",
          "9.0.0.0/8 10.0.0.0/8 192.0.2.1/32");
    check("bypass", "255.255.255.255 10.0.0.0/8 0.0.0.0/0", "0.0.0.0/0");
    check("bypass", "10.0.0.0/33", "", "is not a list of IPv4 prefixes");
    check("check_argument", "usr/bin/true", "", "does not begin with");
    check("check_argument", "/opt/a check", "/opt/a check");
}

TEST(ConfigFile, WrittenFilesReadTheSameIncludingComments) {
    const std::string content = "# of the appliance\n[" + GROUP +
                                "]\n# slow link\nmask_dst_ip = 0x0f\npassword = \" a\\\"b\\\\\"\n"
                                "router/10/ipaddr = 10.0.0.10\nrouter/9/ipaddr = 10.0.0.9\n"
                                "[/qv/wccpd/wccp/policy_grp/config/7]\n"
                                "[" NODE_BYPASS_CONFIG "/10.0.0.0\\/8]\nuntil = 7\n"
                                "[" NODE_ACCEPT_CONFIG "/10.0.0.1]\n"
                                "# of the log\n[/logging/syslog/action/file]\n"
                                "\\/var\\/log\\/messages/facility/all/min_priority = info\n# the end\n";
    config_text text, again;
    // Two of ten routers: reading and writing do not depend on a valid configuration.
    EXPECT_FALSE(config_parse(content, "F", &text));
    const std::string written = config_format(text.tree, text.comments);
    (void)config_parse(written, "F", &again);
    EXPECT_EQ(text.tree.set, again.tree.set) << written;
    EXPECT_EQ(config_format(again.tree, again.comments), written);
    EXPECT_EQ(again.tree.set[named(GROUP + "/password")], " a\"b\\");
    EXPECT_EQ(again.tree.set[named(GROUP + "/mask_dst_ip")], "15");
    EXPECT_TRUE(contains(written, "# of the appliance\n[", "# slow link\nmask_dst_ip",
                         "# of the log\n[/logging/syslog/action/file/", "# the end\n"));
    EXPECT_LT(written.find("router/9/"), written.find("router/10/"));
    EXPECT_TRUE(lacks(written, "weight")) << "a default is not written";
}

// --- The file of a server

TEST_F(Mgmtd, TheFileIsReplacedOnlyIfNothingIsLost) {
    const uint32_t refused = LC_IO_ERROR;
    // Through a link whose target does not exist yet.
    const std::string real = daemon.file.path + ".real";
    ASSERT_EQ(symlink("conf.real", daemon.file.path.c_str()), 0);
    ASSERT_EQ(set("+password=secret"), 0u);
    EXPECT_EQ(mode_of(real), 0600);
    const auto before = daemon.tree.set;
    // A bad or missing file changes nothing when it is read again, and is not overwritten.
    const std::string bad = "[" + GROUP + "]\nweight = heavy\n";
    reload(bad);
    EXPECT_EQ(set("weight=9"), refused);
    EXPECT_TRUE(contains(message(), "SIGHUP"));
    EXPECT_EQ(content(), bad);
    unlink(real.c_str());
    server_reload(&daemon);
    EXPECT_EQ(changes(), "");
    EXPECT_EQ(daemon.tree.set, before);
    EXPECT_EQ(set("weight=9"), 0u) << message();
    reload(content() + "weight = 9\n");
    EXPECT_EQ(set("weight=9 priority=8"), refused) << "an edit that was refused";
    reload("[" + GROUP + "]\nweight = 7\n");
    EXPECT_EQ(set("weight=8"), 0u) << message();

    // A value that would not be read back unchanged is not written.
    const std::string held = content();
    const node_name hidden = named("/logging/syslog/process/a /log_level");
    daemon.tree.set[hidden] = "debug";
    EXPECT_EQ(set("weight=9"), refused);
    EXPECT_TRUE(contains(message(), "would not be read as the same"));
    EXPECT_EQ(changes(), "");
    EXPECT_EQ(content(), held);
    daemon.tree.set.erase(hidden);
    // Neither a device, which a commit would replace, nor a pipe, which would block, is a configuration file.
    const std::string pipe = std::string(file) + "/pipe";
    ASSERT_EQ(mkfifo(pipe.c_str(), 0600), 0);
    for (const std::string &path : {std::string("/dev/null"), pipe}) {
        config_file special = {path, {}};
        config_text text;
        ASSERT_FALSE(config_load(&special, &text)) << path;
        EXPECT_TRUE(contains(text.errors, "not a regular file"));
    }
}

TEST_F(Mgmtd, AStartCleansUpAndReportsProblems) {
    const std::string left = daemon.file.path + ".unfinished",
                      own = "/router/1/ipaddr: 10.0.0.101 is an address";
    daemon.facility_file = std::string(file) + "/new/facility";
    write("[" + GROUP + "]\nrouter/1/ipaddr = 10.0.0.101\n");
    std::ofstream(left) << "[/qv";
    chmod(daemon.file.path.c_str(), 0644);
    const std::string warnings = load();
    EXPECT_TRUE(warnings.starts_with(daemon.file.path + ":2: " + GROUP + own)) << warnings;
    EXPECT_EQ(mode_of(left), -1);
    EXPECT_TRUE(contains(said, "mode 0644"));
    EXPECT_EQ(mode_of(daemon.file.path), 0600);

    // A commit that does not concern the address is accepted, and so is the file with the address.
    EXPECT_EQ(set("weight=8"), 0u) << message();
    reload("[" + GROUP + "]\nrouter/1/ipaddr = 10.0.0.101\nweight = 9\n");
    EXPECT_TRUE(contains(said, own));
    EXPECT_EQ(changes(), "51/weight=8>9");
    reload("[" + GROUP + "]\nrouter/1/ipaddr = 10.0.0.255\n");
    EXPECT_EQ(changes(), "") << said;

    // The facility is written to the file that programs read at startup; its other lines remain.
    EXPECT_EQ(text_of_file(daemon.facility_file), "system 136\n");
    std::ofstream(daemon.facility_file) << "# local\nflow 8\nsystem 16\n";
    reload("[/logging/syslog/facility]\nsystem = 128\n");
    EXPECT_EQ(text_of_file(daemon.facility_file), "system 128\n# local\nflow 8\n");
}

TEST_F(Mgmtd, BypassesExpire) {
    const std::string root = NODE_BYPASS_CONFIG;
    int64_t clock = 1000;
    daemon.clock_s = [&] { return clock; };
    write("[" + root +
          "]\n10.0.0.0\\/8/until = 900\n10.1.0.0\\/16/until = 0\n"
          "10.2.0.0\\/16/until = 1010\n10.3.0.0\\/16/until = 1010\n");
    (void)load();
    const auto kept = [&] {
        query(3, root, bn_query_iterate);
        std::string out;
        for (const std::string &each : found())
            out += each.substr(each.find('=')) + " ";
        return out;
    };
    const uint32_t before = daemon.tree.revision;
    EXPECT_EQ(server_tick(&daemon), now + 10000);
    EXPECT_EQ(kept(), "=10.1.0.0/16 =10.2.0.0/16 =10.3.0.0/16 ");
    EXPECT_TRUE(lacks(content(), "10.0.0.0"));
    clock += 10;
    now += 10000;
    EXPECT_EQ(server_tick(&daemon), -1);
    EXPECT_EQ(kept(), "=10.1.0.0/16 ");
    EXPECT_EQ(daemon.tree.revision, before + 2) << "one commit for all that are due";
    // A failed deletion is tried again later, not at each tick.
    ASSERT_EQ(set("+" + root + "/10.4.0.0\\/16/until=1011"), 0u);
    daemon.file.path = std::string(file) + "/no/such/directory";
    clock++;
    EXPECT_EQ(server_tick(&daemon), now + 60000);
    EXPECT_EQ(server_tick(&daemon), now + 60000);
    EXPECT_EQ(kept(), "=10.1.0.0/16 =10.4.0.0/16 ");
}

} // namespace
