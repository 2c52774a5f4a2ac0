#include "cli/ParseArguments.h"
#include "cli/CommandLine.h"
#include "cli/Usage.h"
#include "platform/scripted/ScriptedKernel.h"

namespace tally {
namespace {

struct Parse {
    std::variant<TLTallyArgs, TLError> result;
    std::string messages;
};

Parse parse(const std::string& words) {
    CommandLine line(words);
    Parse parse;
    parse.messages = written([&] { parse.result = parseArguments(line.argc(), line.argv()); }).second;
    return parse;
}

TEST(ParseArguments, OptionsSetTheirFields) {
    using Args = TLTallyArgs;
    using Strings = std::set<std::string>;
    const auto lettered = [](const Args& a) {
        return a.targetAll && a.targetChildren && a.skipIdleExitClean && a.textOptions == 7 &&
               a.JSONOutputFile == "j" && a.excludedPidsOrProcesses == Strings{"x"} &&
               a.potentialTargetProcesses == Strings{"7", "a", "b"} && a.targetPids.empty() &&
               a.summaryFormat == TLSummaryFormat::pages;
    };
    const struct {
        std::string words;
        bool (*hold)(const Args&);
    } cases[] = {
        {"-atsw --swapped -ji -jj -xx -pa b -p a -fpages 7", lettered}, // later ones replace or add
        {"--all --targetChildren --skip --wide --json j --exclude x --proc a --format=pages b 7", lettered},
        {"-- -a", [](const Args& a) { return a.potentialTargetProcesses == Strings{"-a"} && !a.targetAll; }},
        {"-v", [](const Args& a) { return a.regionlistLikeOutput && !a.summarize; }},
        {"-f bytes", [](const Args& a) { return a.summaryFormat == TLSummaryFormat::bytes; }},
        {"-f bytes -f formatted",
         [](const Args& a) { return a.summaryFormat == TLSummaryFormat::formatted; }},
        {"--sort REGIONS", [](const Args& a) { return a.textSort == "Regions"; }},
        {"--swapped", [](const Args& a) { return a.textOptions == TLTextOptionSwapped; }},
        {"--wired", [](const Args& a) { return a.textOptions == TLTextOptionWired; }},
        {"--benchlog x", [](const Args& a) { return a.benchlogOutputFile == "x" && !a.JSONOutputFile; }},
        {"--unmapped --forkCorpse", [](const Args& a) { return a.searchForUnmapped && a.forkCorpse; }},
        {"--vmObjectDirty",
         [](const Args& a) { return !a.shouldGetPhysTallyBreakdown && a.didSetShouldGetPhysTallyBreakdown; }},
        {"--pid \t12abc --pid -5",
         [](const Args& a) {
             return a.targetPids == TLTargetPids{{-5, {}}, {12, {}}};
         }},
        {"--sample 0.5s", [](const Args& a) { return a.sampleInterval == 0.5; }},
        {"--sample \t+2", [](const Args& a) { return a.sampleInterval == 2; }},
        {"--sample 2.2250738585072014e-308", [](const Args& a) { return a.sampleInterval > 0; }},
    };
    for (const auto& [words, hold] : cases) {
        const Parse got = parse(words);
        const auto* args = std::get_if<TLTallyArgs>(&got.result);
        EXPECT_TRUE(args != nullptr && hold(*args)) << words;
        EXPECT_EQ(got.messages, "");
    }
}

TEST(ParseArguments, TheFirstFailureEndsItAndWarningsDoNot) {
    constexpr int none = -1;
    struct Case {
        std::string words;
        int code;
        std::string text; // on standard error, or of the error
    };
    std::vector<Case> cases = {
        {"-h", TLErrorHelp, ""},
        {"--help -f x", TLErrorHelp, ""},
        {"-f Bytes -h", TLErrorBadFormat,
         "Unrecognized argument to -f / --format.\nAccepted arguments: 'bytes', 'formatted', 'pages'."},
        {"--pid \033", TLErrorBadPid,
         "'?' is not a valid integer for --pid.\n\nUse -p / --proc if you meant to specify a process "
         "name."},
        {"--pid 4294967296", TLErrorBadPid, "'4294967296' is out of the range of pids."}, // not the kernel
        {"--pid -99999999999999999999", TLErrorBadPid,
         "'-99999999999999999999' is out of the range of pids."},
        {"--sample \033", TLErrorBadInterval, "Invalid sampling interval '?'"},
        {"--sort \033", TLErrorBadSort,
         "Unrecognized argument '?' to --sort.\nAccepted arguments: dirty, swapped, clean, reclaimable, "
         "wired, regions, category"},
        {"--forkCorpse -a --unmapped", TLErrorCorpseOfAll,
         "--forkCorpse is not compatible with -a/--all due to corpse resource limits"},
        // What the scanner says goes to the terminal too.
        {"--\033x=1", TLErrorBadOption, "tally: unrecognized option '--?x=1'\n"},
        {"--s\033 7", TLErrorBadOption, "tally: unrecognized option '--s?'\n"},
        {"--s 7", TLErrorBadOption, "tally: option '--s' is ambiguous\n"},
        {"--a=\033", TLErrorBadOption, "tally: option '--a=?' doesn't allow an argument\n"},
        {"-a\033", TLErrorBadOption, "tally: invalid option -- '?'\n"},
        {"-a\xff", TLErrorBadOption, "tally: invalid option -- '?'\n"},
        {"--json", TLErrorBadOption, "tally: option '--json' requires an argument\n"},
        {"-j", TLErrorBadOption, "tally: option requires an argument -- 'j'\n"},
        {"-y", none, "WARNING: -y/--summary options are deprecated because summary is the default mode\n"},
        {"-a --unmapped", none, "NOTICE: '--unmapped' is redundant when using -a/--all\n"},
        {"-a --unmapped --vmObjectDirty", none,
         "WARNING: ignoring '--unmapped' because the requested analysis mode '--vmObjectDirty' does not "
         "support "
         "unmapped owned VM objects\n"},
    };
    for (const std::string seconds : {"0", "-1", "abc", "inf", "nan", "1e999", "1e-310", "0x10"}) {
        cases.push_back(
            {"--sample " + seconds, TLErrorBadInterval, "Invalid sampling interval '" + seconds + "'"});
    }
    for (const auto& [words, code, text] : cases) {
        const Parse got = parse(words);
        const auto* error = std::get_if<TLError>(&got.result);
        EXPECT_EQ(error == nullptr ? none : error->code, code) << words;
        EXPECT_EQ(got.messages + (error == nullptr ? "" : error->message), text);
        EXPECT_TRUE(error != nullptr || !std::get<TLTallyArgs>(got.result).searchForUnmapped);
    }
}

TEST(Usage, ShowsInternalOptionsWhereTheirContentIs) {
    platform::ScriptedKernel kernel;
    kernel.internalContent.insert(subsystemIdentifier);
    EXPECT_TRUE(written(printUsage)
                    .first.ends_with(". 0.5)\n\nKestrelInternal:\n    --benchlog <file.blj>                 "
                                     "print benchlog(1) output to a file\n"));
}

} // namespace
} // namespace tally
