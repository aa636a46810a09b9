#include <dlfcn.h>
#include <netdb.h>
#include <tarq/core.h>
#include <tarq/hacore.h>
#include <tarq/netsdk.h>
#include <tarq/sdk.h>

#include "platform/tarqnetsdk/interfaces.h"
#include "platform/tarqsdk/identity.h"
#include "tests/support/testing.h"

namespace {

std::vector<std::string> resolver_answer;  // literal addresses
int resolver_result = 0;

}  // namespace

// A name service of the test's own: the literal addresses above, in that order.
__attribute__((visibility("default"))) int getaddrinfo(const char*, const char*, const addrinfo*,
                                                       addrinfo** found) {
    static const auto parse =
        reinterpret_cast<decltype(&getaddrinfo)>(dlsym(RTLD_NEXT, "getaddrinfo"));
    addrinfo hints{};
    hints.ai_flags = AI_NUMERICHOST;
    hints.ai_socktype = SOCK_STREAM;
    *found = nullptr;
    for (const std::string& text : resolver_answer) {
        EXPECT_EQ(parse(text.c_str(), nullptr, &hints, found), 0);
        found = &(*found)->ai_next;
    }
    return resolver_result;
}

namespace {

class Host : public testing::Test {
protected:
    void Configure(const std::string& text, const std::string& file = "tarqsdk.conf") const {
        root_.Write("usr/tarq/etc/" + file, text);
    }
    std::string SerialOf(const std::string& configured, size_t size = 36) const {
        Configure("[device]\nserial=\"" + configured + "\"\n");
        std::string buffer(size, '#');
        const bool failed = KAPIGetSerialNumber(buffer.data(), static_cast<int>(size)) < 0;
        EXPECT_EQ(failed, buffer[0] == '\0') << configured;
        return buffer.c_str();
    }
    const test::TempRoot root_;
    const test::TempFolder sys_;
};

TEST_F(Host, SerialComesFromTheFirstSourceThatHasOneUnlessOneCannotBeRead) {
    const auto serial = [&] {
        std::string text = "#";
        return (tarq_sdk::HardwareSerial(sys_.Path(), &text) ? "" : "unreadable") + text;
    };
    EXPECT_EQ(serial(), "");
    sys_.Write("firmware/devicetree/base/serial-number", std::string("1000000f3\0", 10));
    EXPECT_EQ(serial(), "1000000f3");
    sys_.Write("class/dmi/id/board_serial", " BRD 17 \n");
    // Firmware makers' texts are none.
    for (const char* none :
         {"To Be Filled By O.E.M.", "System Serial Number", "Default string\n", "0123456789",
          "000000000", "xxxx", "........", "N/A", " unknown", "evil\"\ncommand=\"x\n"}) {
        sys_.Write("class/dmi/id/product_serial", none);
        EXPECT_EQ(serial(), "BRD 17") << none;
    }
    for (const char* own : {"1A2B3C", "NONE-0042", "0123456789A", "System Serial Number 7"}) {
        sys_.Write("class/dmi/id/product_serial", own);
        EXPECT_EQ(serial(), own);
    }
    fs::remove(sys_.Path("class/dmi/id/product_serial"));
    fs::create_directory(sys_.Path("class/dmi/id/product_serial"));
    EXPECT_EQ(serial(), "unreadable");
}

TEST_F(Host, LongSerialsStayApartAndAreTheSameInEveryRoom) {
    const std::string series = "VENDOR-56 4d 1f 2a 33 44 55 66-77 88 99 aa bb cc dd e";
    const std::string first = SerialOf(series + "1");
    EXPECT_EQ(first.size(), TARQ_SERIAL_NUMBER_MAX);
    EXPECT_EQ(SerialOf(series + "1", 1024), first);
    EXPECT_NE(SerialOf(series + "2"), first);
    EXPECT_EQ(SerialOf(std::string(35, 'a')), std::string(35, 'a'));
    EXPECT_EQ(SerialOf(std::string(35, 'a'), 8), "");
    for (const char* refused : {"a\"b", "a'b", "a`b", "a\\b", "a\tb", "a\xc3\xa4", " a", ""}) {
        EXPECT_EQ(SerialOf(refused), "") << "it would break a command";
        EXPECT_EQ(KAPICErrGet(), TARQ_ERR_BAD_PARAMETER);
    }
}

TEST_F(Host, NameIsCutToItsRoomAndOneThatBreaksACommandIsNone) {
    char name[64];
    Configure("[device]\nhostname=\"" + std::string(70, 'n') + "\"\n");
    EXPECT_EQ(TARQLnxGetHostname(name), 0);
    EXPECT_EQ(name, std::string(63, 'n'));
    Configure("[device]\nhostname=\"a\"b\"\n");
    EXPECT_LT(TARQLnxGetHostname(name), 0);
}

TEST_F(Host, InterfacesComeInAnOrderThatDependsOnTheHardwareAlone) {
    const std::string maker = "00:11:32:00:00:0";
    const struct {
        std::string name, device, mac, assigned = "0", flags = "0x1003";
    } interfaces[] = {
        {"aaa0", "pci/usb1/1-4", maker + "5"},
        {"aab0", "pci/0000:00:01.0", "52:54:00:00:00:06"},  // locally administered
        {"aac0", "platform/soc", maker + "7", "1"},         // random
        {"bond0", "virtual", maker + "1", "2"},
        {"br0", "virtual", maker + "1"},
        {"docker0", "virtual", "02:42:00:00:00:09", "3"},
        {"eth10", "pci/0000:00:1f.6", maker + "2"},
        {"eth2", "pci/0000:00:1f.6", maker + "1", "0", "0x1002"},
        {"lo", "virtual", "00:00:00:00:00:00", "0", "0x9"},
        {"ppp0", "pci/0000:00:02.0", ""},
        {"weird", "pci/0000:00:03.0", "01:00:5e:00:00:01"},  // a group's
        {"zzz0", "pci/0000:00:02.0", maker + "1"},           // the bond's, not its own
    };
    fs::create_directories(sys_.Path("class/net"));
    for (const auto& made : interfaces) {
        const std::string device = "devices/" + made.device;
        const std::string folder = device + "/net/" + made.name;
        for (const auto& [file, text] :
             {std::pair("/address", made.mac), std::pair("/type", std::string("1")),
              std::pair("/flags", made.flags), std::pair("/addr_assign_type", made.assigned)}) {
            sys_.Write(folder + file, text + "\n");
        }
        if (made.device != "virtual") {
            fs::create_directory_symlink(sys_.Path(device), sys_.Path(folder + "/device"));
        }
        fs::create_directory_symlink(sys_.Path(folder), sys_.Path("class/net/" + made.name));
    }
    sys_.Write("devices/virtual/net/br0/bridge/stp_state", "0");
    sys_.Write("devices/pci/0000:00:02.0/net/zzz0/bonding_slave/perm_hwaddr", maker + "3\n");

    const auto listed = tarq_net::ListInterfaces(sys_.Path());
    ASSERT_TRUE(listed);
    std::string names;
    for (const tarq_net::Interface& interface : *listed) {
        names += interface.name + (interface.up ? " " : "(down) ");
    }
    EXPECT_EQ(names, "zzz0 eth2(down) eth10 aaa0 aab0 aac0 bond0 br0 docker0 ");
    EXPECT_EQ(listed->front().mac[5], 3);
    EXPECT_FALSE(tarq_net::ListInterfaces(sys_.Path("nowhere")));

    KAPINetInterface records[2] = {};
    EXPECT_LE(KAPINetGetInterfaceInfo(records, 1, TARQ_NET_INCLUDE_DOWN), 1);
    EXPECT_STREQ(records[1].name, "") << "no more than asked for";
}

TEST_F(Host, NameLookupGivesIpv4FirstAndEachAddressOnceAndTellsAnUnknownNameFromAFailure) {
    TARQNetAddress found[20] = {};
    resolver_answer = {"2001:db8::1", "10.0.0.8", "fe80::1", "10.0.0.7", "10.0.0.8", "2001:db8::1"};
    EXPECT_EQ(TARQNetLookupIP("server", found, 2, 0), 2);
    EXPECT_STREQ(found[2].address, "");
    EXPECT_EQ(TARQNetLookupIP("server", found, 20, 0), 3);
    EXPECT_EQ(found[0].address + ("," + std::string(found[1].address)) + "," + found[2].address,
              "10.0.0.8,10.0.0.7,2001:db8::1");
    resolver_answer.clear();
    resolver_result = EAI_NONAME;
    EXPECT_EQ(TARQNetLookupIP("server", found, 1, 0), 0);
    resolver_result = EAI_AGAIN;
    EXPECT_LT(TARQNetLookupIP("server", found, 1, 0), 0);
    EXPECT_EQ(KAPICErrGet(), TARQ_ERR_LOOKUP);
}

TEST_F(Host, AToolOfTheMakersIsFoundWhereThisHostHasItAndItsAbsenceIsAnErrorOnce) {
    const auto run = [&](const std::string& program) -> std::string {
        FILE* const stream = KAPICPopen(program.c_str(), "r", "x", nullptr);
        if (stream == nullptr) {
            return "none";
        }
        char line[80] = "";
        const bool any = fgets(line, sizeof line, stream) != nullptr;
        return (any ? line : "nothing") + std::to_string(WEXITSTATUS(KAPICPclose(stream)));
    };
    const auto install = [&](const std::string& place, const std::string& text) {
        chmod(root_.Write(place, "#!/bin/sh\nprintf '" + text + "'\n").c_str(), 0755);
    };
    const std::string tool = root_.Path("usr/local/bin/tool");
    EXPECT_EQ(run(tool), "none");
    EXPECT_EQ(run(tool), "nothing1");
    install("usr/bin/tool", "the host");
    EXPECT_EQ(run(tool), "the host0");
    install("usr/local/bin/tool", "the maker");
    EXPECT_EQ(run(tool), "the maker0");
    for (int i = 0; i < 2; ++i) {
        EXPECT_EQ(run(root_.Path("usr/bin/other")), "none");
    }
}

TEST_F(Host, HighAvailabilityMacIsOneOfADeviceOrNone) {
    char mac[18] = "#";
    Configure(
        "[pair]\nrunning=\"yes\"\nmac0=\"02-00-5E-AB-0C-FF\"\nmac1=\"01:00:5e:00:00:01\"\n"
        "mac2=\"00:00:00:00:00:00\"\nmac3=\"02:00:5e:ab:0c\"\nmac4=\"02:00:5e:ab:0c:fg\"\n",
        "tarqha.conf");
    EXPECT_EQ(TARQHAGetMac(0, mac, sizeof mac), 0);
    EXPECT_STREQ(mac, "02:00:5e:ab:0c:ff");
    for (const int index : {-1, 1, 2, 3, 4, 5}) {
        EXPECT_LT(TARQHAGetMac(index, mac, sizeof mac), 0) << index;
    }
    EXPECT_LT(TARQHAGetMac(0, mac, sizeof mac - 1), 0);
}

}  // namespace
