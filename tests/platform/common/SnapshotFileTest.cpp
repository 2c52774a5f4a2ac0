// Snapshot files: what is written comes back, and what anybody else writes is refused with a reason. That
// damaged files which are not refused hold together is the fuzzer's.

#include "platform/quarry.h"
#include "platform/scripted/ScriptedKernel.h"

#include <gtest/gtest.h>

namespace tally::platform {
namespace {

using namespace std::string_literals;

const std::string head = R"({"format":"heapsnap","version":1,"process_name":"p","architecture":"","pid":7,)"
                         R"("page_size":4096,"phys_tally":5,"phys_tally_peak":6,"is_64bit":true,)"
                         R"("shows_phys_tally":true)";

std::string documentWith(const std::string& regions) { return head + ",\"regions\":[" + regions + "]}"; }
std::string region(const std::string& rest) {
    return R"({"address":4096,"length":8192,"type":"t")" + rest + "}";
}

std::string errorOf(const std::string& document) {
    std::string error = "stale";
    const auto graph = QRYDirectedGraphWithData(document, &error);
    EXPECT_EQ(error.empty(), graph != nullptr);
    return error;
}

QRYSnapshot everyField() {
    QRYSnapshot snapshot{.pid = 123,
                         .processName = "a \"b\"\n\xff\xc3\xa4\xf4\x8f\xbe\x80",
                         .is64bit = false,
                         .isTranslated = true,
                         .architecture = "ARM64",
                         .binaryImages = "arm64_32",
                         .vmPageSize = 16384,
                         .physicalTally = 1,
                         .physicalTallyPeak = 2,
                         .showsPhysTally = false};
    snapshot.regions.push_back({.address = 0x10000,
                                .length = 0x20000,
                                .type = Name("__DATA"),
                                .path = Name("/lib/\xfe (deleted)"),
                                .prot = 3,
                                .maxProt = 7,
                                .offset = 0x4000,
                                .user_tag = 30,
                                .resident_size = 0xc000,
                                .shared_now_private_size = 0x4000,
                                .swapped_out_size = 0x8000,
                                .dirty_size = 0x4000,
                                .reusable_size = 0x4001,
                                .ref_count = 65535,
                                .external_pager = 1,
                                .share_mode = 4,
                                .is_submap = true,
                                .object_id = ~std::uint64_t{0} - 1,
                                .is_wired = true,
                                .purgeable = 0});
    snapshot.regions.push_back({.address = 0x30000, .length = 1, .type = Name("")});
    return snapshot;
}

auto fieldsOf(const QRYVMRegion& r) {
    return std::tuple(
        std::tuple(r.address, r.length, r.type, r.path, r.prot, r.maxProt, r.offset, r.user_tag),
        std::tuple(r.resident_size, r.shared_now_private_size, r.swapped_out_size, r.dirty_size,
                   r.reusable_size, r.ref_count, r.external_pager, r.share_mode),
        std::tuple(r.is_submap, r.object_id, r.is_wired, r.purgeable));
}

std::vector<QRYVMRegion> regionsOf(const QRYProcessObjectGraph& graph) {
    std::vector<QRYVMRegion> regions;
    graph.enumerateRegions([&](const QRYVMRegion& each) {
        regions.push_back(each);
        return false;
    });
    return regions;
}

TEST(SnapshotFile, GivesBackWhatWasWritten) {
    const ScriptedKernel kernel;
    const QRYSnapshot written = everyField();
    std::string error;
    const auto graph = QRYDirectedGraphWithData(QRYDataWithSnapshot(written), &error);
    ASSERT_TRUE(graph) << error;
    EXPECT_EQ(graph->processName(), written.processName);
    EXPECT_TRUE(graph->pid() == 123 && !graph->is64bit() && graph->vmPageSize() == 16384);
    EXPECT_TRUE(graph->physicalTally() == 1 && graph->physicalTallyPeak() == 2 && !graph->showsPhysTally());
    EXPECT_EQ(graph->processDescriptionString(), "process on ARM64 (translated)");
    EXPECT_EQ(graph->binaryImagesDescription(), "arm64_32");
    const auto regions = regionsOf(*graph);
    ASSERT_EQ(regions.size(), 2U);
    EXPECT_EQ(fieldsOf(regions[0]), fieldsOf(written.regions[0]));
    EXPECT_EQ(fieldsOf(regions[1]), fieldsOf(written.regions[1]));
    std::size_t visits = 0;
    graph->enumerateRegions([&](const QRYVMRegion&) { return ++visits == 1; });
    EXPECT_EQ(visits, 1U);
}

TEST(SnapshotFile, CarriesNamesOfAnyBytes) {
    const ScriptedKernel kernel;
    for (const std::string& name :
         {""s, "plain"s, "\0\x01\x7f\\\"/"s, "\x80\xbf\xc0\xff"s, "\xc1\xbf"s, "\xc3"s, "\xc3(\xc3\xa4"s,
          "\xe0\x9f\xbf"s, "\xed\xa0\x80\xed\x9f\xbf"s, "\xf0\x8f\xbf\xbf\xf4\x90\x80\x80"s,
          "\xf4\x8f\xbd\xbf\xf4\x8f\xbe\x80\xf4\x8f\xbf\xbf"s, "\xf5\x80\x80\x80 \xf4\x8f\xbe"s}) {
        std::string error;
        const auto graph = QRYDirectedGraphWithData(QRYDataWithSnapshot({.processName = name}), &error);
        ASSERT_TRUE(graph) << error;
        EXPECT_EQ(graph->processName(), name);
    }
}

TEST(SnapshotFile, CarriesTagsOfARunAsNames) {
    std::string contents;
    {
        ScriptedKernel kernel;
        kernel.tagDescriptions = {{120, "my \xff pool"}};
        contents = QRYDataWithSnapshot({.regions = {{.address = 4096, .length = 1, .user_tag = 120},
                                                    {.address = 8192, .length = 1, .user_tag = 121}}});
    }
    ScriptedKernel other;
    other.tagDescriptions = {{120, "something else"}};
    std::string error;
    const auto graph = QRYDirectedGraphWithData(contents, &error);
    ASSERT_TRUE(graph) << error;
    const auto regions = regionsOf(*graph);
    EXPECT_EQ(other.tagDescriptions[regions[0].user_tag], "my \xff pool");
    EXPECT_EQ(regions[1].user_tag, 121U) << "a tag without a name is a number";
}

TEST(SnapshotFile, IsDescribedByAnArchitectureWhoseCacheLiesElsewhere) {
    const ScriptedKernel kernel;
    const struct {
        std::string architecture;
        std::vector<std::uint64_t> addresses; // of a page each
        std::string described;
    } cases[] = {
        {"X86-64", {}, "X86-64"},
        {"", {0x7FF800000000}, "an unknown architecture"},
        {"X86-64", {0x7FF800000000 - 4096}, "X86-64"},
        {"X86-64", {0x7FF800000000 - 4095}, "X86"},
        {"X86-64", {0x7FFFFDFFFFFF}, "X86"},
        {"X86-64", {0x7FFFFE000000}, "X86-64"},
        {"ARM64", {0x180000000, 0x7FF800000000}, "X86"},
        {"X86", {0x90000000, 0x7FF800000000}, "ARM64_32"},
        {"ARM", {0x1A000000, 0x90000000, 0x200000000}, "X86-64"}, // its images say where its cache is
        {"X86-64", {0x50000000, 0x90000000, 0x200000000, 0x7FF800000000}, "an unknown architecture"},
    };
    for (const auto& [architecture, addresses, described] : cases) {
        QRYSnapshot snapshot{.architecture = architecture, .binaryImages = "arm64_32"};
        for (const std::uint64_t address : addresses) {
            snapshot.regions.push_back({.address = address, .length = 4096});
        }
        std::string error;
        const auto graph = QRYDirectedGraphWithData(QRYDataWithSnapshot(snapshot), &error);
        ASSERT_TRUE(graph) << error;
        EXPECT_EQ(graph->processDescriptionString(), "process on " + described);
    }
}

TEST(SnapshotFile, ThatIsWrongSaysWhere) {
    const ScriptedKernel kernel;
    const auto with = [](const std::string& from, const std::string& to) {
        std::string document = documentWith(region(""));
        return document.replace(document.find(from), from.size(), to);
    };
    const std::pair<std::string, std::string> cases[] = {
        {"", "not a heapsnap file: no JSON from byte 1 on"},
        {"\x7f"
         "ELF",
         "not a heapsnap file: no JSON from byte 1 on"},
        {"[]", "not a heapsnap file: the document is a list"},
        {"7", "not a heapsnap file: the document is a number"},
        {R"({"a":1})", "not a heapsnap file: unknown key \"a\""},
        {"{}", "not a heapsnap file: \"format\" is missing"},
        {with("heapsnap", "other"), "not a heapsnap file: its format is \"other\""},
        {with("\"format\":\"heapsnap\",", ""), "not a heapsnap file: \"format\" is missing"},
        {with("1", "2"), "version 2 of the format is not known"},
        {with("1", "-1"), "\"version\" is a negative number"},
        {with("\"version\":1,", ""), "\"version\" is missing"},
        {with("\"pid\":7,", ""), "\"pid\" is missing"},
        {with("\"process_name\":\"p\",", ""), "\"process_name\" is missing"},
        {with("\"is_64bit\":true,", ""), "\"is_64bit\" is missing"},
        {with("7", "null"), "\"pid\" is no value"},
        {with("7", "1.5"), "\"pid\" is a number that is not whole or too large"},
        {with("7", "99999999999999999999"), "\"pid\" is a number that is not whole or too large"},
        {with("7", "2147483648"), "\"pid\" is larger than 2147483647"},
        {with("7", "\"7\""), "\"pid\" is a text"},
        {with("7", "true"), "\"pid\" is true or false"},
        {with("7", "[7]"), "\"pid\" is a list"},
        {with("7", "{}"), "\"pid\" is an object"},
        {with("true", "1"), "\"is_64bit\" is a number"},
        {with("4096", "4095"), "\"page_size\" is none"},
        {with("4096", "256"), "\"page_size\" is none"},
        {with(R"("architecture":"")", R"("architecture":"Z80")"),
         "\"architecture\" is no architecture that is known"},
        {head + "}", "\"regions\" is missing"},
        {head + R"(,"regions":[],"pid":7})", "\"pid\" is there twice"},
        {documentWith("") + "x", "no JSON from byte 184 on"},
        {documentWith("7"), "the document is a number"},
        {documentWith("[]"), "the document is a list"},
        {documentWith(region(",\"new\":0")), "region 0: unknown key \"new\""},
        {documentWith(region("") + "," + region("")),
         "region 1: it begins below the end of the one before it"},
        {documentWith(region(R"(,"length":1)")), "region 0: \"length\" is there twice"},
        {documentWith(R"({"address":4096,"type":"t"})"), "region 0: \"length\" is missing"},
        {documentWith(R"({"address":4096,"length":1})"), "region 0: \"type\" is missing"},
        {documentWith(R"({"address":4096,"length":0,"type":""})"), "region 0: it is empty"},
        {documentWith(R"({"address":4611686018427387905,"length":1,"type":""})"),
         "region 0: \"address\" is larger than 4611686018427387904"},
        {documentWith(region(R"(,"prot":8)")), "region 0: \"prot\" is larger than 7"},
        {documentWith(region(R"(,"resident_size":8193)")),
         "region 0: its sizes are larger than what they are a part of"},
        {documentWith(region(R"(,"resident_size":4096,"swapped_out_size":4097)")),
         "region 0: its sizes are larger than what they are a part of"},
        {documentWith(region(R"(,"resident_size":2,"dirty_size":1,"reusable_size":2)")),
         "region 0: its sizes are larger than what they are a part of"},
        // 2^32 pages
        {documentWith(R"({"address":0,"length":17592186044416,"type":"","resident_size":17592186044416})"),
         "a region has more pages than can be counted"},
        {documentWith(region(R"(,"user_tag":1,"tag_name":"x")")), "region 0: it has two tags"},
        {documentWith(region(R"(,"path":null)")), "region 0: \"path\" is no value"},
        {documentWith(region(R"(,"path":{"a":1})")), "region 0: \"path\" is an object"},
        {std::string(1'000'000, '['), "not a heapsnap file: the document is a list"},
        {head + ",\"regions\":" + std::string(1'000'000, '['), "the document is a list"},
        {std::string(8 << 20, ' '), "not a heapsnap file: no JSON from byte 8388609 on"},
    };
    for (const auto& [document, error] : cases) {
        EXPECT_EQ(errorOf(document), error) << document.substr(0, 400);
    }
    EXPECT_EQ(errorOf(with("4096", "512")), "") << "the smallest page";
    EXPECT_EQ(errorOf(documentWith(region(R"(,"offset":18446744073709547520)"))), "");
    const std::string whole = QRYDataWithSnapshot(everyField());
    for (std::size_t length = 0; length + 1 < whole.size(); ++length) { // the last byte is a newline
        EXPECT_NE(errorOf(whole.substr(0, length)), "") << length;
    }
}

} // namespace
} // namespace tally::platform
