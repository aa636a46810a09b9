#include <arpa/inet.h>
#include <gmock/gmock.h>
#include <gtest/gtest.h>
#include <netdb.h>
#include <sys/socket.h>
#include <tarq/core.h>
#include <tarq/hacore.h>
#include <tarq/netsdk.h>
#include <tarq/sdk.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include "platform/tarqnetsdk/interfaces.h"
#include "platform/tarqsdk/identity.h"
#include "tests/support/temp_root.h"

namespace {

namespace fs = std::filesystem;
using testing::ElementsAre;
using testing::ElementsAreArray;

std::vector<std::string> resolver_answer;  // literal addresses
int resolver_result = 0;

}  // namespace

// A name service of the test's own: the literal addresses above, in that order.
__attribute__((visibility("default"))) int getaddrinfo(const char*, const char*, const addrinfo*,
                                                       addrinfo** found) {
    *found = nullptr;
    for (auto text = resolver_answer.rbegin(); text != resolver_answer.rend(); ++text) {
        auto* storage = new sockaddr_storage{};
        const bool v6 = text->find(':') != std::string::npos;
        if (v6) {
            auto* address = reinterpret_cast<sockaddr_in6*>(storage);
            address->sin6_family = AF_INET6;
            inet_pton(AF_INET6, text->c_str(), &address->sin6_addr);
        } else {
            auto* address = reinterpret_cast<sockaddr_in*>(storage);
            address->sin_family = AF_INET;
            inet_pton(AF_INET, text->c_str(), &address->sin_addr);
        }
        const socklen_t length = v6 ? sizeof(sockaddr_in6) : sizeof(sockaddr_in);
        *found = new addrinfo{0,           v6 ? AF_INET6 : AF_INET,
                              SOCK_STREAM, 0,
                              length,      reinterpret_cast<sockaddr*>(storage),
                              nullptr,     *found};
    }
    return resolver_result;
}
__attribute__((visibility("default"))) void freeaddrinfo(addrinfo* list) noexcept {
    while (list != nullptr) {
        addrinfo* next = list->ai_next;
        delete reinterpret_cast<sockaddr_storage*>(list->ai_addr);
        delete list;
        list = next;
    }
}

namespace {

std::string Serial(int size) {
    std::string buffer(static_cast<size_t>(size), '#');
    EXPECT_EQ(KAPIGetSerialNumber(buffer.data(), size), 0);
    return buffer.c_str();
}

std::string Hostname() {
    char buffer[64];
    return TARQLnxGetHostname(buffer) == 0 ? buffer : "";
}

void Configure(const test::TempRoot& root, const std::string& file, const std::string& text) {
    root.Write("usr/tarq/etc/" + file, text);
}

TEST(SerialNumber, TextsOfFirmwareMakersAreNone) {
    for (const char* text :
         {"To Be Filled By O.E.M.", "System Serial Number", "Default string", "None", "0123456789",
          "Not Specified", "000000000", "XXXXXXX", "xxxx", "........", "N/A", " unknown"}) {
        EXPECT_TRUE(tarq_sdk::IsPlaceholder(text)) << text;
    }
    for (const char* text : {"1A2B3C", "NONE-0042", "0123456789A", "System Serial Number 7"}) {
        EXPECT_FALSE(tarq_sdk::IsPlaceholder(text)) << text;
    }
}

TEST(SerialNumber, ComesFromTheFirstSourceThatHasOne) {
    const test::TempFolder sys;
    std::string serial;
    EXPECT_TRUE(tarq_sdk::HardwareSerial(sys.Path(), &serial));
    EXPECT_EQ(serial, "");

    sys.Write("firmware/devicetree/base/serial-number", std::string("1000000f3\0", 10));
    EXPECT_TRUE(tarq_sdk::HardwareSerial(sys.Path(), &serial));
    EXPECT_EQ(serial, "1000000f3");

    sys.Write("class/dmi/id/product_serial", "Default string\n");
    sys.Write("class/dmi/id/board_serial", " BRD 17 \n");
    EXPECT_TRUE(tarq_sdk::HardwareSerial(sys.Path(), &serial));
    EXPECT_EQ(serial, "BRD 17");

    sys.Write("class/dmi/id/product_serial", "evil\"\ncommand=\"x\n");
    EXPECT_TRUE(tarq_sdk::HardwareSerial(sys.Path(), &serial));
    EXPECT_EQ(serial, "BRD 17");
}

TEST(SerialNumber, SourceThatCannotBeReadIsNotReplacedByAnother) {
    const test::TempFolder sys;
    sys.Write("class/dmi/id/product_serial/is-a-folder", "");
    sys.Write("class/dmi/id/board_serial", "BRD17");
    std::string serial;
    EXPECT_FALSE(tarq_sdk::HardwareSerial(sys.Path(), &serial));
    EXPECT_EQ(serial, "");
}

TEST(SerialNumber, LongOnesStayApartAndAreTheSameInEveryRoom) {
    const test::TempRoot root;
    const std::string series = "VENDOR-56 4d 1f 2a 33 44 55 66-77 88 99 aa bb cc dd e";
    Configure(root, "tarqsdk.conf", "[device]\nserial=\"" + series + "1\"\n");
    const std::string first = Serial(36);
    EXPECT_EQ(first.size(), TARQ_SERIAL_NUMBER_MAX);
    EXPECT_EQ(Serial(1024), first);
    Configure(root, "tarqsdk.conf", "[device]\nserial=\"" + series + "2\"\n");
    EXPECT_NE(Serial(36), first);

    const std::string longest(35, 'a');
    Configure(root, "tarqsdk.conf", "[device]\nserial=\"" + longest + "\"\n");
    EXPECT_EQ(Serial(36), longest);
    char small[8] = "#######";
    EXPECT_LT(KAPIGetSerialNumber(small, sizeof small), 0);
    EXPECT_STREQ(small, "");
}

TEST(SerialNumber, ConfiguredOneWithCharactersThatBreakACommandIsRefused) {
    const test::TempRoot root;
    for (const char* serial : {"a\"b", "a'b", "a`b", "a\\b", "a\tb", "a\xc3\xa4", " a", ""}) {
        Configure(root, "tarqsdk.conf", std::string("[device]\nserial=\"") + serial + "\"\n");
        char buffer[36] = "#";
        EXPECT_LT(KAPIGetSerialNumber(buffer, sizeof buffer), 0) << serial;
        EXPECT_EQ(KAPICErrGet(), TARQ_ERR_BAD_PARAMETER);
        EXPECT_STREQ(buffer, "");
    }
    EXPECT_LT(KAPIGetSerialNumber(nullptr, 36), 0);
}

TEST(Hostname, IsTheKernelsUnlessConfigured) {
    const test::TempRoot root;
    char kernel[65];
    ASSERT_EQ(gethostname(kernel, sizeof kernel), 0);
    EXPECT_EQ(Hostname(), std::string(kernel).substr(0, 63));
    Configure(root, "tarqsdk.conf", "[device]\nhostname=\"nas-two\"\n");
    EXPECT_EQ(Hostname(), "nas-two");
    Configure(root, "tarqsdk.conf", "[device]\nhostname=\"" + std::string(70, 'n') + "\"\n");
    EXPECT_EQ(Hostname(), std::string(63, 'n'));
    Configure(root, "tarqsdk.conf", "[device]\nhostname=\"a\"b\"\n");
    EXPECT_EQ(Hostname(), "");
}

/// Makes /sys/class/net/<name>: below a device's folder, or virtual when `device` is empty.
void MakeInterface(const test::TempFolder& sys, const std::string& name, const std::string& device,
                   const std::string& mac, int assigned = 0, const std::string& flags = "0x1003") {
    const std::string folder = "devices/" + (device.empty() ? "virtual" : device) + "/net/" + name;
    sys.Write(folder + "/address", mac + "\n");
    sys.Write(folder + "/type", "1\n");
    sys.Write(folder + "/flags", flags + "\n");
    sys.Write(folder + "/addr_assign_type", std::to_string(assigned) + "\n");
    if (!device.empty()) {
        fs::create_directory_symlink(sys.Path("devices/" + device), sys.Path(folder + "/device"));
    }
    fs::create_directories(sys.Path("class/net"));
    fs::create_directory_symlink(sys.Path(folder), sys.Path("class/net/" + name));
}

TEST(Interfaces, ComeInAnOrderThatDependsOnTheHardwareAlone) {
    const test::TempFolder sys;
    MakeInterface(sys, "aaa0", "pci/usb1/1-4", "00:11:32:00:00:05");
    MakeInterface(sys, "aab0", "pci/0000:00:01.0", "52:54:00:00:00:06");
    MakeInterface(sys, "aac0", "platform/soc", "00:11:32:00:00:07", 1);
    MakeInterface(sys, "bond0", "", "00:11:32:00:00:01", 2);
    MakeInterface(sys, "br0", "", "00:11:32:00:00:01");
    sys.Write("devices/virtual/net/br0/bridge/stp_state", "0");
    MakeInterface(sys, "docker0", "", "02:42:00:00:00:09", 3);
    MakeInterface(sys, "eth10", "pci/0000:00:1f.6", "00:11:32:00:00:02");
    MakeInterface(sys, "eth2", "pci/0000:00:1f.6", "00:11:32:00:00:01", 0, "0x1002");
    MakeInterface(sys, "lo", "", "00:00:00:00:00:00", 0, "0x9");
    MakeInterface(sys, "ppp0", "pci/0000:00:02.0", "");
    MakeInterface(sys, "weird", "pci/0000:00:03.0", "01:00:5e:00:00:01");
    MakeInterface(sys, "zzz0", "pci/0000:00:02.0", "00:11:32:00:00:01");
    sys.Write("devices/pci/0000:00:02.0/net/zzz0/bonding_slave/perm_hwaddr", "00:11:32:00:00:03\n");

    const auto interfaces = tarq_net::ListInterfaces(sys.Path());
    ASSERT_TRUE(interfaces);
    std::vector<std::string> names;
    for (const tarq_net::Interface& interface : *interfaces) {
        names.push_back(interface.name);
        EXPECT_EQ(interface.up, interface.name != "eth2");
    }
    EXPECT_THAT(names, ElementsAre("zzz0", "eth2", "eth10", "aaa0", "aab0", "aac0", "bond0", "br0",
                                   "docker0"));
    EXPECT_THAT(interfaces->front().mac, ElementsAreArray({0x00, 0x11, 0x32, 0x00, 0x00, 0x03}));
    EXPECT_FALSE(tarq_net::ListInterfaces(sys.Path("nowhere")));
}

TEST(Interfaces, FillNoMoreRecordsThanAskedFor) {
    KAPINetInterface records[64];
    const int all = KAPINetGetInterfaceInfo(records, 64, TARQ_NET_INCLUDE_DOWN);
    ASSERT_GE(all, 0);
    EXPECT_LE(KAPINetGetInterfaceInfo(records, 64, 0), all);
    for (int i = 0; i < all; ++i) {
        EXPECT_STRNE(records[i].name, "lo");
    }
    KAPINetInterface one[2] = {};
    EXPECT_EQ(KAPINetGetInterfaceInfo(one, 1, TARQ_NET_INCLUDE_DOWN), std::min(all, 1));
    EXPECT_STREQ(one[1].name, "");
    EXPECT_LT(KAPINetGetInterfaceInfo(nullptr, 1, 1), 0);
}

std::vector<std::string> LookUp(int count) {
    std::vector<TARQNetAddress> records(20);
    const int filled = TARQNetLookupIP("server", records.data(), count, 0);
    std::vector<std::string> texts;
    texts.reserve(records.size());
    for (int i = 0; i < filled; ++i) {
        texts.emplace_back(records[static_cast<size_t>(i)].address);
    }
    return texts;
}

TEST(NameLookup, GivesIpv4FirstAndEachAddressOnce) {
    resolver_result = 0;
    resolver_answer = {"2001:db8::1", "10.0.0.8", "fe80::1", "10.0.0.7", "10.0.0.8", "2001:db8::1"};
    EXPECT_THAT(LookUp(20), ElementsAre("10.0.0.8", "10.0.0.7", "2001:db8::1"));
    EXPECT_THAT(LookUp(2), ElementsAre("10.0.0.8", "10.0.0.7"));
}

TEST(NameLookup, TellsAnUnknownNameFromAFailure) {
    resolver_answer.clear();
    TARQNetAddress record;
    resolver_result = EAI_NONAME;
    EXPECT_EQ(TARQNetLookupIP("server", &record, 1, 0), 0);
    resolver_result = EAI_AGAIN;
    EXPECT_LT(TARQNetLookupIP("server", &record, 1, 0), 0);
    EXPECT_EQ(KAPICErrGet(), TARQ_ERR_LOOKUP);
    EXPECT_LT(TARQNetLookupIP("", &record, 1, 0), 0);
    EXPECT_EQ(KAPICErrGet(), TARQ_ERR_BAD_PARAMETER);
}

TEST(HighAvailability, IsWhatIsConfigured) {
    const test::TempRoot root;
    char mac[18] = "#";
    EXPECT_EQ(TARQHAIsRunning(), 0);
    EXPECT_LT(TARQHAGetMac(0, mac, sizeof mac), 0);
    EXPECT_STREQ(mac, "");

    Configure(root, "tarqha.conf",
              "[pair]\nrunning=\"yes\"\nmac0=\"02-00-5E-AB-0C-FF\"\nmac1=\"01:00:5e:00:00:01\"\n"
              "mac2=\"00:00:00:00:00:00\"\nmac3=\"02:00:5e:ab:0c\"\nmac4=\"02:00:5e:ab:0c:fg\"\n");
    EXPECT_EQ(TARQHAIsRunning(), 1);
    EXPECT_EQ(TARQHAGetMac(0, mac, sizeof mac), 0);
    EXPECT_STREQ(mac, "02:00:5e:ab:0c:ff");
    for (const int index : {-1, 1, 2, 3, 4, 5}) {
        EXPECT_LT(TARQHAGetMac(index, mac, sizeof mac), 0) << index;
    }
    EXPECT_LT(TARQHAGetMac(0, mac, sizeof mac - 1), 0);

    Configure(root, "tarqha.conf", "[pair]\nrunning=\"no\"\n");
    EXPECT_EQ(TARQHAIsRunning(), 0);
}

}  // namespace
