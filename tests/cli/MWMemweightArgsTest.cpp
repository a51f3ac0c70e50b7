#include "cli/MWMemweightArgs.h"

#include <gtest/gtest.h>

#include "cli/CommandLine.h"

namespace {

using Names = std::set<std::string>;

struct Parsed {
    tl::expected<MWMemweightArgs, MWError> args;
    std::string standardError;
};

Parsed parse(const std::vector<std::string>& arguments) {
    const CommandLine line(arguments);
    testing::internal::CaptureStderr();
    auto args = MWMemweightArgs::initWithArgc(line.argc(), line.argv());
    return {std::move(args), testing::internal::GetCapturedStderr()};
}

MWMemweightArgs parsed(const std::vector<std::string>& arguments) {
    auto result = parse(arguments);
    EXPECT_TRUE(result.args.has_value());
    EXPECT_EQ(result.standardError, "");
    return result.args.value_or(MWMemweightArgs());
}

/// "CODE: DESCRIPTION" of a command line that is refused, CODE alone where there is no description.
std::string refusal(const std::vector<std::string>& arguments) {
    const auto result = parse(arguments);
    if (result.args) {
        return "accepted";
    }
    const MWError& error = result.args.error();
    EXPECT_EQ(error.domain, "MWMemweightError");
    return std::to_string(error.code) + (error.description ? ": " + *error.description : "");
}

}  // namespace

TEST(MWMemweightArgs, ShortAndLongFormsMeanTheSame) {
    const auto shortForms = parsed({"-atsv", "-j", "a.json", "-p", "bash", "-x", "sh", "-f", "pages", "-w"});
    const auto longForms = parsed({"--all", "--targetChildren", "--skip", "-v", "--json=a.json", "--proc",
                                   "bash", "--exclude", "sh", "--format=pages", "--wide"});
    for (const auto& args : {shortForms, longForms}) {
        EXPECT_TRUE(args.targetAll() && args.targetChildren() && args.skipIdleExitClean());
        EXPECT_TRUE(args.spanlistLikeOutput());
        EXPECT_FALSE(args.summarize());
        EXPECT_EQ(args.JSONOutputFile(), "a.json");
        EXPECT_EQ(args.potentialTargetProcesses(), Names{"bash"});
        EXPECT_EQ(args.excludedPidsOrProcesses(), Names{"sh"});
        EXPECT_EQ(args.summaryFormat(), MWSummaryFormat::pages);
        EXPECT_EQ(args.textOptions(), 7);
    }
    EXPECT_EQ(parsed({"--wired", "--swapped"}).textOptions(), 3);
    EXPECT_EQ(parsed({"--sort", "clean", "--sort", "REGIONS"}).textSort(), "Regions");
    EXPECT_EQ(parsed({"--statpack", "a.spj"}).statpackOutputFile(), "a.spj");
}

TEST(MWMemweightArgs, TargetsStandAnywhereAndAreHeldOnce) {
    EXPECT_EQ(parsed({"bash", "-p", "sshd", "12", "bash", "--", "-v"}).potentialTargetProcesses(),
              (Names{"bash", "sshd", "12", "-v"}));
    EXPECT_EQ(parsed({"--pid", "42x", "--pid= -7", "--pid", "42"}).targetPids(),
              (MWPidMap{{-7, std::nullopt}, {42, std::nullopt}}));
    // 2^32 + 1 must not become pid 1.
    EXPECT_EQ(parsed({"--pid", "4294967297"}).targetPids(), (MWPidMap{{INT32_MAX, std::nullopt}}));
}

TEST(MWMemweightArgs, SampleTakesPositiveDecimalNumbers) {
    EXPECT_EQ(parsed({"--sample", "0.5"}).sampleInterval(), 0.5);
    EXPECT_EQ(parsed({"--sample", "1e-3"}).sampleInterval(), 0.001);
    for (const std::string bad : {"0", "-1", "abc", "inf", "nan", "", "1e-310", "1e999", "0x10"}) {
        EXPECT_EQ(refusal({"--sample", bad}), "9: Invalid sampling interval '" + bad + "'");
    }
}

TEST(MWMemweightArgs, RefusesWithCodeAndDescription) {
    EXPECT_EQ(refusal({"-h"}), "1");
    EXPECT_EQ(refusal({"-w", "bash", "--help", "--sort", "nonsense"}), "1");
    EXPECT_EQ(refusal({"-f", "Bytes"}).substr(0, 1), "2");
    EXPECT_EQ(refusal({"--sort", "size"}),
              "3: Unrecognized argument 'size' to --sort.\n"
              "Accepted arguments: dirty, swapped, clean, reclaimable, wired, regions, category");
    EXPECT_EQ(refusal({"--sort", "dirt"}).substr(0, 1), "3");
    EXPECT_EQ(refusal({"--pid", "abc"}),
              "4: 'abc' is not a valid integer for --pid.\n\n"
              "Use -p / --proc if you meant to specify a process name.");
    EXPECT_EQ(refusal({"--nonsense"}), "5");
    EXPECT_EQ(refusal({"bash", "-j"}), "5");
    EXPECT_EQ(refusal({"--s"}), "5");  // an abbreviation of several options
    EXPECT_EQ(refusal({"--v"}), "5");
    EXPECT_EQ(refusal({"bash", "--vers", "--sort", "nonsense"}), "10");
    EXPECT_EQ(refusal({"--pid", "abc", "-h"}).substr(0, 1), "4");
    EXPECT_EQ(refusal({"-aha"}), "1");
    EXPECT_FALSE(parsed({"bash"}).targetAll()) << "the scan starts afresh after one that ended in a group";
}

TEST(MWMemweightArgs, DeprecatedOptionsOnlyWarn) {
    const auto result = parse({"-v", "-y", "--physMemweight"});
    EXPECT_FALSE(result.args->summarize());
    EXPECT_EQ(result.standardError,
              "WARNING: -y/--summary options are deprecated because summary is the default mode\n"
              "WARNING: --physMemweight option is deprecated because it is the default mode\n");
}

TEST(MWMemweightArgs, UnmappedGivesWayToWhatMakesItUseless) {
    const std::string warning =
        "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
        "support unmapped owned VM objects\n";
    EXPECT_TRUE(parsed({"--unmapped"}).searchForUnmapped());
    for (const auto& result :
         {parse({"--unmapped", "--vmObjectDirty"}), parse({"--vmObjectDirty", "--unmapped"}),
          parse({"--unmapped", "--vmObjectDirty", "-a"})}) {
        EXPECT_EQ(result.standardError, warning);
        EXPECT_FALSE(result.args->searchForUnmapped());
        EXPECT_FALSE(result.args->shouldGetPhysMemweightBreakdown());
        EXPECT_TRUE(result.args->didSetShouldGetPhysMemweightBreakdown());
    }
    const auto redundant = parse({"--unmapped", "-a"});
    EXPECT_EQ(redundant.standardError, "NOTICE: '--unmapped' is redundant when using -a/--all\n");
    EXPECT_FALSE(redundant.args->searchForUnmapped());
}
