#include "linux/Agreement.h"
#include "linux/Puppet.h"

#include <gtest/gtest.h>
#include <nlohmann/json.hpp>

#include <algorithm>
#include <array>
#include <cstdio>
#include <fstream>
#include <map>
#include <regex>
#include <sstream>

namespace tally::test {

namespace {

using nlohmann::json;

/// What one report says: a place in it ("7 own heap") and its figures there, rising.
using Facts = std::vector<std::string>;

std::string joined(const auto& items) {
    std::ostringstream text;
    for (const auto& item : items) {
        text << ' ' << item;
    }
    return text.str();
}

constexpr std::size_t mostNamed = 20; // a larger set of sharers is a number in the text

/// Reads one text report line by line.
class TextReader {
  public:
    Facts read(const std::string& report) {
        std::istringstream lines(report);
        for (std::string line; std::getline(lines, line);) {
            readLine(line);
        }
        std::sort(facts_.begin(), facts_.end());
        return facts_;
    }

  private:
    void readLine(const std::string& line) {
        if (readRow(line) || readRegion(line)) {
            return;
        }
        static const std::regex listing(R"((.*) \[(\d+)\])");
        static const std::regex header(R"((.*) \[(\d+)\]: (?:64|32)-bit.*)");
        static const std::regex total(R"(.*\tTally: (\d+) B \(\d+ bytes per page\))"); // below warnings
        static const std::regex summary(R"(Summary Tally: (\d+) B.*)");
        static const std::regex auxiliary("(\t+)(.*?):(?: (-?\\d+) B)?");
        std::smatch match;
        if (std::regex_match(line, match, header)) {
            pid_ = match[2];
            where_ = pid_ + " own";
        }
        if (std::regex_match(line, match, total)) {
            facts_.push_back(pid_ + " total: " + match[1].str());
        } else if (std::regex_match(line, match, listing)) {
            pid_ = match[2];
        } else if (line.starts_with("Shared with ")) {
            where_ = pid_ + " shared" + sharers(line);
        } else if (std::regex_match(line, match, summary)) {
            where_ = pid_ = "summary";
            facts_.push_back("summary total: " + match[1].str());
        } else if (std::regex_match(line, match, auxiliary)) {
            path_.resize(match[1].length() - 1);
            path_.push_back(match[2]);
            if (match[3].matched) {
                facts_.push_back(pid_ + " auxiliary" + joined(path_) + ": " + match[3].str());
            }
        }
    }

    using Figures = std::array<unsigned long long, 6>;

    bool readRow(const std::string& line) {
        Figures n{};
        int name = 0;
        std::sscanf(line.c_str(), "%llu B %llu B %llu B %llu B %llu B %llu %n", &n[0], &n[1], &n[2], &n[3],
                    &n[4], &n[5], &name);
        if (name == 0) {
            return false;
        }
        if (line.substr(name) != "TOTAL" || where_ == "summary") { // no other sum is in the document
            facts_.push_back(where_ + " " + line.substr(name) + ":" + joined(n));
        }
        return true;
    }

    bool readRegion(const std::string& line) {
        Figures n{};
        std::array<char, 24> start{}, end{}, id{};
        int name = 0;
        std::sscanf(line.c_str(), "%23s - %23s [ %23[0-9a-f]] %llu %llu %llu %llu %llu %llu %n", start.data(),
                    end.data(), id.data(), &n[0], &n[1], &n[2], &n[3], &n[4], &n[5], &name);
        if (name == 0) {
            return false;
        }
        facts_.push_back(pid_ + " region " + start.data() + " " + end.data() + " " + id.data() + " " +
                         line.substr(name) + ":" + joined(n));
        return true;
    }

    std::string sharers(const std::string& line) const {
        static const std::regex number(R"(Shared with (\d+) processes:)");
        static const std::regex name(R"(\[(\d+)\](?=,|:$))");
        std::smatch match;
        if (std::regex_match(line, match, number)) {
            return " " + match[1].str();
        }
        std::vector<int> pids{std::stoi(pid_)};
        for (std::sregex_iterator at(line.begin(), line.end(), name); at != std::sregex_iterator(); ++at) {
            pids.push_back(std::stoi((*at)[1]));
        }
        std::sort(pids.begin(), pids.end());
        return joined(pids);
    }

    std::string pid_, where_;
    std::vector<std::string> path_; // of auxiliary keys
    Facts facts_;
};

std::string hexadecimal(std::uint64_t number) {
    std::ostringstream text;
    text << std::hex << number;
    return text.str();
}

void addCategories(Facts& facts, const std::string& where, const json& categories) {
    for (const auto& [name, sizes] : categories.items()) {
        std::string fact = where + " " + (where == "summary" && name == "total" ? "TOTAL" : name) + ":";
        for (const char* key : {"dirty", "swapped", "clean", "reclaimable", "wired", "regions"}) {
            fact += " " + sizes.at(key).dump();
        }
        facts.push_back(fact);
    }
}

void addAuxiliary(Facts& facts, const std::string& place, const json& value) {
    for (const auto& [key, entry] : value.items()) { // null has none
        if (entry.is_object()) {
            addAuxiliary(facts, place + " " + key, entry);
        } else {
            facts.push_back(place + " " + key + ": " + entry.dump());
        }
    }
}

void addRegions(Facts& facts, const std::string& pid, const json& process) {
    const std::uint64_t page = process.at("page size");
    for (const json& region : process.at("regions")) {
        const auto size = [&](const char* key) { return region.value(key, std::uint64_t{0}); };
        const auto pages = [&](std::uint64_t bytes) {
            return " " + std::to_string((bytes + page - 1) / page);
        };
        const std::uint64_t start = size("addr");
        const std::string range = region.contains("addr")
                                      ? hexadecimal(start) + " " + hexadecimal(start + size("vsize"))
                                      : "unmapped unmapped";
        facts.push_back(pid + " region " + range + " " + hexadecimal(size("id") & 0xffffffffff) + " " +
                        region.at("name").get<std::string>() + ":" + pages(size("vsize")) +
                        pages(size("dirty") + size("swapped")) + pages(size("swapped")) +
                        pages(size("clean")) + pages(size("reclaimable")) + pages(size("wired")));
    }
}

/// The records of "shared" that `pid` sees: its own view, or the common one.
std::vector<json> sharedOf(const json& report, const json& pid) {
    std::vector<json> records;
    for (const json& record : report.at("shared")) {
        const json& pids = record.at("pids");
        if (std::find(pids.begin(), pids.end(), pid) != pids.end() &&
            record.value("specific_to_pid", pid) == pid) {
            records.push_back(record);
        }
    }
    return records;
}

Facts factsOf(const json& report) {
    Facts facts;
    for (const json& process : report.at("processes")) {
        const std::string pid = process.at("pid").dump();
        if (process.contains("tally")) {
            facts.push_back(pid + " total: " + process["tally"].dump());
        }
        addRegions(facts, pid, process);
        addCategories(facts, pid + " own", process.value("categories", json::object()));
        addAuxiliary(facts, pid + " auxiliary", process.at("auxiliary"));
        for (const json& record : sharedOf(report, process["pid"])) {
            const auto pids = record["pids"].get<std::vector<int>>();
            addCategories(facts,
                          pid + " shared" +
                              (pids.size() > mostNamed ? " " + std::to_string(pids.size()) : joined(pids)),
                          record["categories"]);
        }
    }
    if (report["processes"].size() != 1) {
        facts.push_back("summary total: " + report.at("total tally").dump());
        addCategories(facts, "summary", report.at("summary"));
        addAuxiliary(facts, "summary auxiliary", report.at("auxiliary"));
    }
    std::sort(facts.begin(), facts.end());
    return facts;
}

/// What the performance data must say of `report`: metrics with their values, group by group.
std::vector<std::map<std::string, double>> metricsOf(const json& report) {
    std::vector<std::map<std::string, double>> groups;
    const auto add = [&](const std::string& name, const json& categories) {
        for (const auto& [category, sizes] : categories.items()) {
            if (category != "total") {
                groups.back()[category + "," + name] += sizes.at("dirty").get<double>();
            }
        }
    };
    const auto addAux = [&](const std::string& name, const json& auxiliary) {
        Facts facts;
        addAuxiliary(facts, "aux_data", auxiliary);
        for (std::string& fact : facts) {
            const std::size_t colon = fact.rfind(": ");
            const double value = std::stod(fact.substr(colon + 2));
            std::replace(fact.begin(), fact.end(), ' ', '.');
            groups.back()[fact.substr(0, colon) + "," + name] = value;
        }
    };
    for (const json& process : report.at("processes")) {
        const std::string name = process.at("name");
        groups.emplace_back();
        if (process.contains("tally")) {
            groups.back()["total_memory," + name] = process["tally"];
            for (const json& record : sharedOf(report, process["pid"])) {
                add(name, record["categories"]);
            }
        }
        add(name, process.value("categories", json::object()));
        addAux(name, process["auxiliary"]);
    }
    groups.emplace_back()["total_memory,ALL_PROCESSES"] = report.at("total tally");
    add("ALL_PROCESSES", report.at("summary"));
    addAux("ALL_PROCESSES", report["auxiliary"]);
    const auto nanoseconds = [&](const char* key) {
        return report.at(key)["mach_continuous_time_ns"].get<std::uint64_t>();
    };
    groups.back()["gather_duration,"] =
        static_cast<double>((nanoseconds("end_time") - nanoseconds("start_time")) / 1'000'000);
    return groups;
}

std::vector<std::map<std::string, double>> metricsIn(const std::string& benchlog) {
    std::vector<std::map<std::string, double>> groups;
    std::istringstream lines(benchlog);
    std::string line;
    std::getline(lines, line);
    EXPECT_EQ(json::parse(line).at("benchlog"), 1);
    while (std::getline(lines, line)) {
        const json entry = json::parse(line);
        if (!entry.contains("metric")) {
            EXPECT_EQ(entry.at("group"), groups.size() + 1);
            groups.emplace_back();
            continue;
        }
        EXPECT_EQ(entry.at("group"), groups.size());
        const std::string process = entry.contains("variables") ? entry["variables"].at("process") : "";
        groups.back()[entry["metric"].get<std::string>() + "," + process] = entry.at("value");
    }
    return groups;
}

void expectEqual(const Facts& text, const Facts& document) {
    Facts onlyText, onlyDocument;
    std::set_difference(text.begin(), text.end(), document.begin(), document.end(),
                        std::back_inserter(onlyText));
    std::set_difference(document.begin(), document.end(), text.begin(), text.end(),
                        std::back_inserter(onlyDocument));
    EXPECT_TRUE(onlyText.empty() && onlyDocument.empty())
        << "of " << text.size() << " only in the text (" << onlyText.size()
        << "): " << (onlyText.empty() ? "" : onlyText[0]) << "\nonly in the document (" << onlyDocument.size()
        << "): " << (onlyDocument.empty() ? "" : onlyDocument[0]);
}

} // namespace

std::string contentsOf(const std::string& path) {
    std::ostringstream text;
    text << std::ifstream(path).rdbuf();
    return text.str();
}

std::size_t expectAgreement(const std::string& text, const std::string& document,
                            const std::string& benchlog) {
    const json parsed = json::parse(document);
    const json reports = parsed.value("samples", json::array({parsed}));
    std::vector<std::map<std::string, double>> metrics;
    std::size_t at = 0;
    for (const json& report : reports) {
        std::string part = text;
        if (parsed.contains("samples")) {
            std::string date = report.at("start_time").at("date");
            date[10] = ' ';
            EXPECT_EQ(text.substr(at, 30 + 1).substr(0, 6 + date.size()), "Time: " + date);
            const std::size_t next = text.find("\nTime: ", at);
            part = text.substr(at, next == text.npos ? next : next + 1 - at);
            at = next == text.npos ? text.size() : next + 1;
        }
        expectEqual(TextReader().read(part), factsOf(report));
        const auto expected = metricsOf(report);
        metrics.insert(metrics.end(), expected.begin(), expected.end());
    }
    if (parsed.contains("samples")) {
        EXPECT_EQ(at, text.size()) << "the text has more samples";
    }
    EXPECT_EQ(metricsIn(benchlog), metrics);
    return reports.size();
}

void expectValid(const std::vector<std::string>& paths) {
    std::vector<std::string> command{"/usr/bin/python3", "-m", "jsonschema"};
    for (const std::string& path : paths) {
        command.insert(command.end(), {"-i", path});
    }
    command.emplace_back(JSON_SCHEMA);
    const Outcome outcome = run(command);
    EXPECT_EQ(outcome.status, 0) << outcome.output << outcome.errors;
}

} // namespace tally::test
