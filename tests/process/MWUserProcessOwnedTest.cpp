#include <gtest/gtest.h>

#include <cerrno>
#include <nlohmann/json.hpp>
#include <string>
#include <thread>
#include <vector>

#include "platform/MWPhysMemweightSwitch.h"
#include "process/InspectedProcess.h"

// What the kernel tells of a process beside its regions.

namespace {

constexpr size_t kEntry = sizeof(OwnedObjectRecord);
constexpr size_t kRoom = 16 * kEntry;

/// A process that asks the host, as all do outside of tests.
class AskingProcess : public MWUserProcess {
public:
    static std::shared_ptr<AskingProcess> of(int32_t pid) {
        proc_bsdinfo info = {};
        EXPECT_GT(MWHostInterface::current().proc_pidinfo(pid, info), 0);
        auto process = std::make_shared<AskingProcess>();
        EXPECT_TRUE(process->_initWithBsdInfo(info));
        return process;
    }
    uint64_t pageTables() const { return _ledgers[0]; }
    using MWUserProcess::_gatherOwnedVmObjects;
};

class OwnedByProcess : public testing::Test {
protected:
    void SetUp() override {
        MWPhysMemweightSwitch::set(true);
        _host.processes[7] = {.comm = "owner", .ownedError = 0};
    }
    FakeProcess& process() { return _host.processes[7]; }
    std::optional<MWOwnedObjects> ask() {
        _process = AskingProcess::of(7);
        return _process->_gatherOwnedVmObjects();
    }
    void own(size_t count) {
        for (uint64_t identifier = 1; identifier <= count; ++identifier) {
            process().owned.push_back({.object_id = identifier, .resident = 100 * identifier});
        }
    }

    FakeHost _host;
    std::shared_ptr<AskingProcess> _process;
};

TEST_F(OwnedByProcess, ChargeAndPeakAreAuxiliaryDataOfTheProcessAlone) {
    process().usage = {.ri_phys_memweight = 4096, .ri_lifetime_max_phys_memweight = 8192};
    const auto charged = AskingProcess::of(7);
    ASSERT_NE(charged->auxData(), nullptr);
    EXPECT_EQ(charged->auxData()->jsonRepresentation().dump(),
              R"({"phys_memweight":4096,"phys_memweight_peak":8192})");
    EXPECT_EQ(charged->auxData()->mergeWithData(nullptr), nullptr) << "charges of processes are not added up";
    process().usage->ri_phys_memweight = 5000;
    charged->gatherData();
    EXPECT_EQ(charged->phys_memweight(), 5000U) << "read again when it is gathered";
    process().usage.reset();
    EXPECT_EQ(AskingProcess::of(7)->auxData(), nullptr);
}

TEST_F(OwnedByProcess, PageTablesAreFoundByTheNameOfTheirLedger) {
    std::vector<std::string> names(170, "tasks");
    names[165] = "page_table";
    _host.ledgerNames = names;
    process().ledgerBalances = std::vector<int64_t>(170, 9);
    process().ledgerBalances[165] = 123456;
    EXPECT_EQ(AskingProcess::of(7)->pageTables(), 123456U);
    EXPECT_EQ(_host.asked("ledgerTemplate"), 3) << "80 and 160 entries were too few";
    process().ledgerBalances[165] = -5;
    EXPECT_EQ(AskingProcess::of(7)->pageTables(), 0U);
    EXPECT_EQ(_host.asked("ledgerTemplate"), 3) << "read once";
    MWPhysMemweightSwitch::set(false);
    process().ledgerError = EIO;
    EXPECT_TRUE(AskingProcess::of(7)->warnings().empty()) << "not asked in this mode";
}

TEST_F(OwnedByProcess, TheLedgerTableIsReadOnceByManyThreads) {
    _host.ledgerNames = {"page_table"};
    std::vector<std::thread> threads;
    for (int thread = 0; thread < 8; ++thread) {
        threads.emplace_back([this] { EXPECT_EQ(_host.ledgerTable().pageTableIndex, 0); });
    }
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(_host.asked("ledgerTemplate"), 1);
}

TEST_F(OwnedByProcess, WithoutLedgersThereAreNoPageTables) {
    _host.ledgerNames = {"tasks"};
    process().ledgerBalances = {77};
    EXPECT_EQ(AskingProcess::of(7)->pageTables(), 0U);

    FakeHost refusing;
    MWPhysMemweightSwitch::set(true);
    refusing.processes[7] = {.comm = "owner"};
    refusing.ledgerTemplateError = EPERM;
    testing::internal::CaptureStderr();
    AskingProcess::of(7);
    AskingProcess::of(7);
    EXPECT_EQ(testing::internal::GetCapturedStderr(),
              "Unable to retrieve ledger template info: Operation not permitted\n")
        << "told once";
    EXPECT_EQ(refusing.ledgerTable().entryCount, -1);
}

TEST_F(OwnedByProcess, ALedgerThatCannotBeReadIsAWarning) {
    _host.ledgerNames = {"page_table"};
    process().ledgerError = EIO;
    testing::internal::CaptureStderr();
    const Lines warnings = AskingProcess::of(7)->warnings();
    const std::string text = "owner [7]: Unable to retrieve ledger entry info - Input/output error";
    EXPECT_EQ(testing::internal::GetCapturedStderr(), text + "\n");
    EXPECT_EQ(warnings, Lines{text});
}

TEST_F(OwnedByProcess, OwnedObjectsAreFetchedWithRoomForMore) {
    own(3);
    const auto objects = ask();
    ASSERT_TRUE(objects);
    ASSERT_EQ(objects->size(), 3U);
    EXPECT_EQ(objects->at(2).resident, 200U);
    EXPECT_EQ(_host.ownedFetches, std::vector<size_t>{8 + 3 * kEntry + kRoom});
}

TEST_F(OwnedByProcess, AReplyThatFillsTheBufferIsFetchedAgain) {
    own(19);
    process().ownedAtFirst = 3;
    const auto objects = ask();
    ASSERT_TRUE(objects);
    EXPECT_EQ(objects->size(), 19U);
    const size_t first = 8 + 3 * kEntry + kRoom;
    EXPECT_EQ(_host.ownedFetches, (std::vector<size_t>{first, first + kRoom}));
    _host.ownedReplyIsEndless = true;
    testing::internal::CaptureStderr();
    EXPECT_FALSE(ask());
    EXPECT_NE(testing::internal::GetCapturedStderr(), "");
    EXPECT_EQ(_process->warnings().size(), 1U);
}

TEST_F(OwnedByProcess, NothingOwnedAndNothingToldAreDifferent) {
    const auto none = ask();
    ASSERT_TRUE(none);
    EXPECT_TRUE(none->empty());
    EXPECT_TRUE(_host.ownedFetches.empty());
    own(2);
    _host.ownedReplyIsCut = true;
    EXPECT_TRUE(ask() && ask()->empty()) << "a reply shorter than it says";
    EXPECT_TRUE(_process->warnings().empty());
    process().ownedError = ENOENT;
    EXPECT_FALSE(ask());
    EXPECT_TRUE(_process->warnings().empty()) << "this kernel has no such list";
    MWPhysMemweightSwitch::set(false);
    process().ownedError = EPERM;
    EXPECT_FALSE(ask());
    EXPECT_TRUE(_process->warnings().empty()) << "not asked in this mode";
}

TEST_F(OwnedByProcess, ARefusedListIsAWarning) {
    own(1);
    for (int* error : {&process().ownedFetchError, &process().ownedError}) {
        *error = EPERM;
        testing::internal::CaptureStderr();
        EXPECT_FALSE(ask());
        EXPECT_EQ(testing::internal::GetCapturedStderr(),
                  "owner [7]: vm.get_owned_vmobjects - Operation not permitted\n");
        EXPECT_EQ(_process->warnings(), Lines{"owner [7]: vm.get_owned_vmobjects - Operation not permitted"});
    }
}

TEST_F(OwnedByProcess, OnlyOfProcessesThatWillBeAskedIsSurveyedWhatTheyOwn) {
    const auto isSurveyedWithOwned = [this](AskingProcess& process) {
        _host.surveyed.clear();
        process.prepareToGatherData();
        return _host.surveyed.empty() ? std::nullopt : std::optional(_host.surveyed.begin()->second);
    };
    const auto shown = AskingProcess::of(7);
    EXPECT_EQ(isSurveyedWithOwned(*shown), true);
    const auto hidden = AskingProcess::of(7);
    hidden->setHiddenFromDisplay(true);
    EXPECT_EQ(isSurveyedWithOwned(*hidden), false) << "it is measured all the same";
    MWPhysMemweightSwitch::set(false);
    EXPECT_EQ(isSurveyedWithOwned(*shown), false);
}

}  // namespace
