#include "base/BatchEnumeration.h"
#include "base/Format.h"
#include "base/Name.h"

#include <gtest/gtest.h>

#include <numeric>
#include <thread>
#include <vector>

namespace tally {
namespace {

TEST(Printable, ReplacesWhatCouldDriveATerminalAndNothingElse) {
    const std::pair<std::string, std::string> cases[] = {
        {"plain ~", "plain ~"},
        {"a\033[31mb\n\t\x7f", "a?[31mb???"},
        {std::string("nul\0!", 5), "nul?!"},
        {"gr\xc3\xbc\xc3\x9f \xe2\x82\xac \xf0\x9f\x90\x8c",
         "gr\xc3\xbc\xc3\x9f \xe2\x82\xac \xf0\x9f\x90\x8c"},
        {"\xc2\x9b"
         "31m\xc2\xa0",
         "?31m\xc2\xa0"},   // a C1 control, and the first letter that is none
        {"\x9b\xa0", "??"}, // lone bytes
        {"\xff\xc3", "??"}, // cut off at the end
        {"\xc3\n", "??"},   // a cut-off letter hides no control
        {"\xe2\x82\x1b", "???"},
        // marks of direction and line ends, and their neighbours
        {"\u061c\u200e\u200f\u2028\u202e\u2066\u2069", "???????"},
        {"\u061b\u200d\u2010\u2027\u202f\u2065\u206a", "\u061b\u200d\u2010\u2027\u202f\u2065\u206a"},
    };
    for (const auto& [text, safe] : cases) {
        EXPECT_EQ(printable(text), safe);
    }
}

TEST(ThreadName, IsOnePointerPerTextOnEveryThread) {
    const std::size_t texts = 500;
    std::vector<std::vector<Name>> byThread(4, std::vector<Name>(texts));
    {
        std::vector<std::jthread> threads;
        for (auto& names : byThread) {
            threads.emplace_back([&names] {
                for (std::size_t i = 0; i < names.size(); ++i) {
                    names[i] = Name("name " + std::to_string(i));
                }
            });
        }
    }
    for (const auto& names : byThread) {
        EXPECT_EQ(names, byThread.front());
    }
    EXPECT_EQ(byThread[0][42].view(), "name 42");
    EXPECT_NE(byThread[0][42], byThread[0][43]);
    EXPECT_NE(Name(), Name("")) << "an absent name is no empty text";
    EXPECT_TRUE(Name().empty() && Name("").empty() && Name().isNull() && !Name("").isNull());
    EXPECT_EQ(Name(std::string_view("a\0b", 3)).view().size(), 3);
}

TEST(BatchEnumeration, HandsOnEverySliceOnceAndInOrder) {
    struct Case {
        std::size_t items;
        std::size_t batch;
        std::vector<std::size_t> slices;
    };
    const Case cases[] = {{0, 4, {}}, {3, 4, {3}}, {8, 4, {4, 4}}, {9, 4, {4, 4, 1}}, {2, 0, {1, 1}}};
    for (const Case& expected : cases) {
        std::vector<int> items(expected.items);
        std::iota(items.begin(), items.end(), 0);
        std::vector<int> seen;
        std::vector<std::size_t> slices;
        tl_enumerateObjectsWithBatchSize(std::span(items), expected.batch, [&](std::span<int> slice) {
            slices.push_back(slice.size());
            seen.insert(seen.end(), slice.begin(), slice.end());
        });
        EXPECT_EQ(slices, expected.slices);
        EXPECT_EQ(seen, items);
    }
}

} // namespace
} // namespace tally
