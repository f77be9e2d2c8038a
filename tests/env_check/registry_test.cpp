#include <dlfcn.h>

#include <cstring>
#include <map>
#include <string>
#include <type_traits>
#include <typeinfo>
#include <utility>
#include <vector>

#include "checker.h"
#include "env_check.h"
#include "support/sandbox.h"

using ::testing::ElementsAre;
using namespace TERN::HA::Daemon;

namespace {

using Factory = EnvCheck* (*)();

template <class T>
Factory factoryOf() {
    return &createEnvCheckT<T>;
}

std::vector<std::string> registeredNames() {
    std::vector<std::string> names;
    if (CheckerFactory::opMap != nullptr) {
        for (const auto& entry : *CheckerFactory::opMap) {
            names.push_back(entry.first);
        }
    }
    return names;
}

const std::vector<std::string> namesBeforeMain = registeredNames();

// A delete expression would be a warning: checks have no virtual destructor.
void release(EnvCheck* check) {
    ::operator delete(check);
}

class Impostor : public EnvCheck {};

class RegistryTest : public test::SandboxTest {};

TEST_F(RegistryTest, HoldsTheFiveChecksBeforeMain) {
    EXPECT_THAT(namesBeforeMain, ElementsAre("is_alive", "is_disk_err_handling", "is_md_resync",
                                             "reboot_remote", "remote_hostname"));
}

template <class Check>
class RegisteredCheckTest : public test::SandboxTest {};
using Checks = ::testing::Types<IsRemoteAlive, IsRemoteMDResync, IsRemoteDiskErrHandling, RebootRemote,
                                GetRemoteHostname>;
TYPED_TEST_SUITE(RegisteredCheckTest, Checks, );

TYPED_TEST(RegisteredCheckTest, FactoryOfItsTypeNameCreatesIt) {
    TypeParam own;
    const auto entry = CheckerFactory::opMap->find(own.getType());
    ASSERT_NE(entry, CheckerFactory::opMap->end());
    EnvCheck* const made = entry->second();
    EXPECT_EQ(typeid(*made), typeid(TypeParam));
    EXPECT_EQ(made->getType(), own.getType());
    release(made);
}

TYPED_TEST(RegisteredCheckTest, HoldsOnlyTheVirtualTablePointer) {
    EXPECT_EQ(sizeof(TypeParam), sizeof(void*));
    static_assert(!std::has_virtual_destructor_v<TypeParam>);
    static_assert(std::is_trivially_destructible_v<TypeParam>);
    static_assert(std::is_empty_v<CheckerRegister<TypeParam>>);
    static_assert(std::is_same_v<decltype(TypeParam::reg), CheckerRegister<TypeParam>>);
}

TEST_F(RegistryTest, FirstFactoryOfANameWins) {
    const Factory first = CheckerFactory::opMap->at("is_alive");
    const CheckerRegister<Impostor> second("is_alive");
    EXPECT_EQ(CheckerFactory::opMap->at("is_alive"), first);
    EXPECT_NE(first, factoryOf<Impostor>());
}

TEST_F(RegistryTest, NewNameIsRegistered) {
    const CheckerRegister<Impostor> registration("new_check");
    EXPECT_EQ(CheckerFactory::opMap->at("new_check"), factoryOf<Impostor>());
}

TEST_F(RegistryTest, FirstRegistrationCreatesTheMap) {
    auto* const map = std::exchange(CheckerFactory::opMap, nullptr);
    const CheckerRegister<Impostor> registration("first_check");
    ASSERT_NE(CheckerFactory::opMap, nullptr);
    EXPECT_THAT(*CheckerFactory::opMap,
                ElementsAre(std::pair<const std::string, Factory>("first_check", factoryOf<Impostor>())));
    delete std::exchange(CheckerFactory::opMap, map);
}

TEST_F(RegistryTest, LibraryLoadedLaterRegistersItsCheck) {
    EXPECT_EQ(CheckerFactory::opMap->count("late_check"), 0U);
    void* const library = dlopen(LATE_CHECK, RTLD_NOW | RTLD_NODELETE);
    ASSERT_NE(library, nullptr) << dlerror();
    ASSERT_EQ(CheckerFactory::opMap->count("late_check"), 1U);
    EnvCheck* const check = CheckerFactory::opMap->at("late_check")();
    Status status;
    EXPECT_EQ(check->handle(status), "better late than never");
    EXPECT_EQ(check->getType(), "late_check");
    release(check);
    dlclose(library);
}

TEST_F(RegistryTest, BaseClassSendsNothing) {
    EnvCheck check;
    Json::Value out = "before";
    Status status;
    EXPECT_TRUE(check());
    EXPECT_TRUE(check(out));
    EXPECT_EQ(out, Json::Value("before"));
    EXPECT_EQ(check.handle(status), "Undefine");
    EXPECT_EQ(check.getType(), "Undefine");
}

// Return the virtual table, as a host built against older headers sees it.
using Slot = void (*)();
const Slot* slotsOf(const EnvCheck& check) {
    const Slot* table = nullptr;
    std::memcpy(static_cast<void*>(&table), static_cast<const void*>(&check), sizeof table);
    return table;
}

TEST_F(RegistryTest, VirtualFunctionsAreInTheDocumentedOrder) {
    EnvCheck base;
    const Slot* const slots = slotsOf(base);
    Json::Value out;
    Status status;
    EXPECT_TRUE(reinterpret_cast<bool (*)(EnvCheck*)>(slots[0])(&base));
    EXPECT_TRUE(reinterpret_cast<bool (*)(EnvCheck*, Json::Value&)>(slots[1])(&base, out));
    EXPECT_EQ(reinterpret_cast<std::string (*)(EnvCheck*, Status&)>(slots[2])(&base, status), "Undefine");
    EXPECT_EQ(reinterpret_cast<std::string (*)(EnvCheck*)>(slots[3])(&base), "Undefine");

    IsRemoteAlive alive;
    const Slot* const aliveSlots = slotsOf(alive);
    EXPECT_EQ(reinterpret_cast<std::string (*)(EnvCheck*, Status&)>(aliveSlots[2])(&alive, status), "alive");
    EXPECT_EQ(reinterpret_cast<std::string (*)(EnvCheck*)>(aliveSlots[3])(&alive), "is_alive");
}

// Return which of the four virtual functions a check overrides.
std::vector<bool> ownSlots(const EnvCheck& check) {
    const EnvCheck base;
    std::vector<bool> own;
    for (int slot = 0; slot < 4; ++slot) {
        own.push_back(slotsOf(check)[slot] != slotsOf(base)[slot]);
    }
    return own;
}

TEST_F(RegistryTest, EachCheckOverridesOnlyItsOwnFunctions) {
    EXPECT_THAT(ownSlots(IsRemoteAlive()), ElementsAre(true, false, true, true));
    EXPECT_THAT(ownSlots(IsRemoteMDResync()), ElementsAre(true, false, true, true));
    EXPECT_THAT(ownSlots(IsRemoteDiskErrHandling()), ElementsAre(false, true, true, true));
    EXPECT_THAT(ownSlots(RebootRemote()), ElementsAre(false, false, true, true));
    EXPECT_THAT(ownSlots(GetRemoteHostname()), ElementsAre(false, false, true, true));
}

TEST_F(RegistryTest, HostnameCheckInheritsOperatorsThatSendNothing) {
    GetRemoteHostname check;
    EnvCheck& base = check;
    Json::Value out = "before";
    EXPECT_TRUE(base());
    EXPECT_TRUE(base(out));
    EXPECT_EQ(out, Json::Value("before"));
}

using AddressFunction = std::string (*)(const std::string&);
const std::map<std::string, AddressFunction> addressFunctions = {
    {"drbdIF", drbdIF}, {"localIP", localIP}, {"remoteIP", remoteIP}};

class AddressTest : public test::SandboxTest, public ::testing::WithParamInterface<std::string> {
 protected:
    const AddressFunction address = addressFunctions.at(GetParam());
};

TEST_P(AddressTest, IsInitiallyEmpty) {
    EXPECT_EQ(address(""), "");
}

TEST_P(AddressTest, EmptyArgumentReturnsTheStoredValue) {
    EXPECT_EQ(address("10.0.0.2"), "10.0.0.2");
    EXPECT_EQ(address(""), "10.0.0.2");
    EXPECT_EQ(address(""), "10.0.0.2");
}

TEST_P(AddressTest, NonEmptyArgumentReplacesTheValue) {
    address("10.0.0.2");
    EXPECT_EQ(address("any text"), "any text");
    EXPECT_EQ(address(""), "any text");
}

TEST_P(AddressTest, IsIndependentOfTheOthers) {
    address("10.0.0.2");
    for (const auto& [name, other] : addressFunctions) {
        EXPECT_EQ(other(""), name == GetParam() ? "10.0.0.2" : "") << name;
    }
}

INSTANTIATE_TEST_SUITE_P(Functions, AddressTest, ::testing::Values("drbdIF", "localIP", "remoteIP"));

}  // namespace
