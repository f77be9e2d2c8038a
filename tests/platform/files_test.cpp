#include <filesystem>

#include "platform_test.h"

namespace platform_test {
namespace {

constexpr char CONFIG[] = "/tmp/ha.conf";
constexpr char UNTOUCHED = '~';

struct Lookup {
    int result = 0;
    std::string value;

    bool operator==(const Lookup& other) const { return result == other.result && value == other.value; }
    friend std::ostream& operator<<(std::ostream& stream, const Lookup& lookup) {
        return stream << lookup.result << " \"" << lookup.value << '"';
    }
};

const Lookup MISSING = {0, ""};

Lookup lookUpIn(const char* file, const char* key = "ha_hostname") {
    char value[64];
    std::fill(std::begin(value), std::end(value), UNTOUCHED);
    const int result = PLATFileGetKeyValue(file, key, static_cast<char*>(value), sizeof value, 0);
    return {result, static_cast<const char*>(value)};
}

Lookup lookUp(const std::string& content) {
    test::writeFile(CONFIG, content);
    return lookUpIn(CONFIG);
}

class KeyValueTest : public test::SandboxTest {};

TEST_F(KeyValueTest, PlainValue) {
    EXPECT_EQ(lookUp("ha_hostname=pair1\n"), (Lookup{1, "pair1"}));
    EXPECT_EQ(lookUp("other=a\nha_hostname=pair1\nlast=b\n"), (Lookup{1, "pair1"}));
}

TEST_F(KeyValueTest, QuotedValue) {
    EXPECT_EQ(lookUp("ha_hostname=\"pair1\"\n"), (Lookup{1, "pair1"}));
    EXPECT_EQ(lookUp("ha_hostname=\" pair 1 \"\n"), (Lookup{1, " pair 1 "}));
}

TEST_F(KeyValueTest, UnpairedQuoteBelongsToTheValue) {
    EXPECT_EQ(lookUp("ha_hostname=\"pair1\n"), (Lookup{1, "\"pair1"}));
    EXPECT_EQ(lookUp("ha_hostname=pair1\"\n"), (Lookup{1, "pair1\""}));
    EXPECT_EQ(lookUp("ha_hostname=\"\n"), (Lookup{1, "\""}));
}

TEST_F(KeyValueTest, SurroundingBlanksAreIgnored) {
    EXPECT_EQ(lookUp(" \tha_hostname \t= \tpair 1 \t\n"), (Lookup{1, "pair 1"}));
    EXPECT_EQ(lookUp("ha_hostname = \"pair1\" \n"), (Lookup{1, "pair1"}));
}

TEST_F(KeyValueTest, CommentsAndOtherLinesAreIgnored) {
    EXPECT_EQ(lookUp("#ha_hostname=a\n  # ha_hostname=b\n\n \nha_hostname\nha_hostname=pair1\n"),
              (Lookup{1, "pair1"}));
    EXPECT_EQ(lookUp("#ha_hostname=a\n"), MISSING);
    test::writeFile(CONFIG, "#key=a\n");
    EXPECT_EQ(lookUpIn(CONFIG, "#key"), MISSING);
}

TEST_F(KeyValueTest, KeyMustMatchWhole) {
    EXPECT_EQ(lookUp("ha_hostname2=a\nxha_hostname=b\nHA_HOSTNAME=c\nha=d\n=e\n"), MISSING);
}

TEST_F(KeyValueTest, ValueBeginsAfterTheFirstEqualsSign) {
    EXPECT_EQ(lookUp("ha_hostname=a=b#c\n"), (Lookup{1, "a=b#c"}));
}

TEST_F(KeyValueTest, EmptyValueIsFound) {
    EXPECT_EQ(lookUp("ha_hostname=\n"), (Lookup{1, ""}));
    EXPECT_EQ(lookUp("ha_hostname= \"\" \n"), (Lookup{1, ""}));
}

TEST_F(KeyValueTest, FirstOfTwoEqualKeysWins) {
    EXPECT_EQ(lookUp("ha_hostname=first\nha_hostname=second\n"), (Lookup{1, "first"}));
}

TEST_F(KeyValueTest, CarriageReturnIsStripped) {
    EXPECT_EQ(lookUp("ha_hostname=pair1\r\n"), (Lookup{1, "pair1"}));
    EXPECT_EQ(lookUp("other=a\r\n\r\nha_hostname=\"pair1\"\r\n"), (Lookup{1, "pair1"}));
}

TEST_F(KeyValueTest, LastLineNeedsNoNewline) {
    EXPECT_EQ(lookUp("other=a\nha_hostname=pair1"), (Lookup{1, "pair1"}));
}

TEST_F(KeyValueTest, KeyFarDownInALongFileIsFound) {
    std::string content;
    for (int i = 0; i < 2000; ++i) {
        content += "key" + std::to_string(i) + "=value" + std::to_string(i) + "\n";
    }
    test::writeFile(CONFIG, content);
    for (const int i : {0, 250, 251, 252, 253, 1000, 1999}) {
        EXPECT_EQ(lookUpIn(CONFIG, ("key" + std::to_string(i)).c_str()),
                  (Lookup{1, "value" + std::to_string(i)}));
    }
}

TEST_F(KeyValueTest, MissingKeyReturnsZero) {
    EXPECT_EQ(lookUp("other=a\n"), MISSING);
    EXPECT_EQ(lookUp(""), MISSING);
}

TEST_F(KeyValueTest, UnreadableFileIsAFailure) {
    EXPECT_EQ(lookUpIn("/tmp/no-such-file"), (Lookup{-1, ""}));
    EXPECT_EQ(lookUpIn("/tmp"), (Lookup{-1, ""}));
}

TEST_F(KeyValueTest, LongValueIsTruncatedAndTerminated) {
    for (const char* const line : {"ha_hostname=abcdefgh\n", "ha_hostname=\"abcdefgh\"\n"}) {
        test::writeFile(CONFIG, line);
        for (const std::size_t size : {1U, 2U, 8U, 9U, 10U}) {
            std::string buffer(16, UNTOUCHED);
            EXPECT_EQ(PLATFileGetKeyValue(CONFIG, "ha_hostname", buffer.data(), static_cast<int>(size), 0),
                      1);
            std::string expected = std::string("abcdefgh").substr(0, size - 1) + '\0';
            expected.resize(buffer.size(), UNTOUCHED);
            EXPECT_EQ(buffer, expected) << "size " << size;
        }
    }
}

TEST_F(KeyValueTest, BufferWithoutRoomIsAFailure) {
    test::writeFile(CONFIG, "ha_hostname=pair1\n");
    for (const int size : {0, -1}) {
        char byte = UNTOUCHED;
        EXPECT_EQ(PLATFileGetKeyValue(CONFIG, "ha_hostname", &byte, size, 0), -1);
        EXPECT_EQ(byte, UNTOUCHED);
    }
}

TEST_F(KeyValueTest, InvalidArgumentsAreFailures) {
    test::writeFile(CONFIG, "ha_hostname=pair1\n");
    char value[8] = {UNTOUCHED};
    char* const start = static_cast<char*>(value);
    EXPECT_EQ(PLATFileGetKeyValue(CONFIG, "ha_hostname", start, sizeof value, 1), -1);
    EXPECT_STREQ(start, "");
    EXPECT_EQ(PLATFileGetKeyValue(CONFIG, "ha_hostname", start, sizeof value, -1), -1);
    EXPECT_EQ(PLATFileGetKeyValue(CONFIG, nullptr, start, sizeof value, 0), -1);
    EXPECT_EQ(PLATFileGetKeyValue(nullptr, "ha_hostname", start, sizeof value, 0), -1);
    EXPECT_EQ(PLATFileGetKeyValue(CONFIG, "ha_hostname", nullptr, sizeof value, 0), -1);
}

class FileExistTest : public test::SandboxTest {};

TEST_F(FileExistTest, IsTrueForAnythingThatExists) {
    test::writeFile("/tmp/file", "");
    std::filesystem::create_symlink("/tmp/file", "/tmp/link");
    EXPECT_TRUE(PLATFileExist("/tmp/file"));
    EXPECT_TRUE(PLATFileExist("/tmp/link"));
    EXPECT_TRUE(PLATFileExist("/tmp"));
    EXPECT_TRUE(PLATFileExist("/dev/null"));
}

TEST_F(FileExistTest, IsFalseForAMissingFileAndADanglingLink) {
    std::filesystem::create_symlink("/tmp/no-such-file", "/tmp/link");
    EXPECT_FALSE(PLATFileExist("/tmp/no-such-file"));
    EXPECT_FALSE(PLATFileExist("/tmp/link"));
    EXPECT_FALSE(PLATFileExist(""));
    EXPECT_FALSE(PLATFileExist(nullptr));
}

// Block devices as libata shows them in sysfs.
class AtaPortTest : public test::SandboxTest {
 protected:
    static constexpr char DISK[] = "0\n";
    static constexpr char OPTICAL_DRIVE[] = "5\n";

    static void addDevice(const std::string& name, const std::string& port, const std::string& type = DISK) {
        const std::string scsiDevice =
            "devices/pci0000:00/0000:00:1f.2/" + port + "/host2/target2:0:0/2:0:0:" + name;
        const std::string device = scsiDevice + "/block/" + name;
        test::writeFile("/sys/" + scsiDevice + "/type", type);
        test::makeDirectories("/sys/" + device);
        std::filesystem::create_symlink("../../../2:0:0:" + name, "/sys/" + device + "/device");
        std::filesystem::create_symlink("../" + device, "/sys/block/" + name);
    }

    // Return the disk name of the port, or "none".
    static std::string nameAt(const char* port) {
        std::string buffer(8, UNTOUCHED);
        const int result = TERNDiskGetDevnamebyAtaPort(buffer.data(), static_cast<int>(buffer.size()), port);
        if (result == -1) {
            EXPECT_EQ(buffer, std::string(8, UNTOUCHED));
            return "none";
        }
        EXPECT_EQ(result, 0);
        return buffer.substr(0, buffer.find('\0'));
    }
};

TEST_F(AtaPortTest, ReturnsTheDiskOnThePort) {
    addDevice("sda", "ata3");
    addDevice("sdb", "ata4");
    EXPECT_EQ(nameAt("ata3"), "sda");
    EXPECT_EQ(nameAt("ata4"), "sdb");
}

TEST_F(AtaPortTest, PortNameMustMatchWhole) {
    addDevice("sda", "ata10");
    for (const char* const port : {"ata1", "ata", "ta10", "10", "ata100", "ata10/", "/ata10"}) {
        EXPECT_EQ(nameAt(port), "none") << port;
    }
    addDevice("sdb", "ata1");
    EXPECT_EQ(nameAt("ata1"), "sdb");
    EXPECT_EQ(nameAt("ata10"), "sda");
}

TEST_F(AtaPortTest, OpticalDriveIsSkipped) {
    addDevice("sr0", "ata2", OPTICAL_DRIVE);
    EXPECT_EQ(nameAt("ata2"), "none");
    addDevice("sr1", "ata3", OPTICAL_DRIVE);
    addDevice("sra", "ata3");
    EXPECT_EQ(nameAt("ata3"), "sra");
}

TEST_F(AtaPortTest, ReturnsTheFirstDiskByName) {
    addDevice("sdc", "ata3");
    addDevice("sdb", "ata3");
    addDevice("sdd", "ata3");
    EXPECT_EQ(nameAt("ata3"), "sdb");
}

TEST_F(AtaPortTest, NameLongerThanTheBufferIsAFailure) {
    addDevice("sdabcde", "ata3");
    addDevice("sdabcdef", "ata4");
    EXPECT_EQ(nameAt("ata3"), "sdabcde");
    EXPECT_EQ(nameAt("ata4"), "none");
}

TEST_F(AtaPortTest, OtherDevicesAreSkipped) {
    test::makeDirectories("/sys/block/loop0/ata3");
    test::makeDirectories("/sys/devices/virtual/block/md0");
    std::filesystem::create_symlink("../devices/virtual/block/md0", "/sys/block/md0");
    addDevice("sda", "ata3");
    EXPECT_EQ(nameAt("ata3"), "sda");
}

TEST_F(AtaPortTest, PortWithoutADiskIsAFailure) {
    EXPECT_EQ(nameAt("ata3"), "none");
    addDevice("sda", "ata4");
    EXPECT_EQ(nameAt("ata3"), "none");
}

TEST_F(AtaPortTest, MachineWithoutBlockDevicesIsAFailure) {
    test::removeTree("/sys/block");
    EXPECT_EQ(nameAt("ata3"), "none");
}

TEST_F(AtaPortTest, InvalidArgumentsAreFailures) {
    addDevice("sda", "ata3");
    test::makeDirectories("/sys/block/loop0");
    EXPECT_EQ(nameAt(""), "none");
    EXPECT_EQ(nameAt(nullptr), "none");
    EXPECT_EQ(TERNDiskGetDevnamebyAtaPort(nullptr, 8, "ata3"), -1);
    for (const int size : {0, -1}) {
        char byte = UNTOUCHED;
        EXPECT_EQ(TERNDiskGetDevnamebyAtaPort(&byte, size, "ata3"), -1);
        EXPECT_EQ(byte, UNTOUCHED);
    }
}

}  // namespace
}  // namespace platform_test
