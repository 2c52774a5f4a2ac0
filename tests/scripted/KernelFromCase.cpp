#include "scripted/KernelFromCase.h"

#include <cctype>
#include <sstream>
#include <stdexcept>

namespace tally {

using namespace platform;

namespace {

/// "D3.2C" as "DDD..C".
std::string repeatedLetters(const std::string& runs) {
    std::string letters;
    for (std::size_t i = 0; i < runs.size();) {
        const char letter = runs[i++];
        std::size_t times = 0;
        while (i < runs.size() && std::isdigit(static_cast<unsigned char>(runs[i])) != 0) {
            times = times * 10 + static_cast<std::size_t>(runs[i++] - '0');
        }
        letters.append(times == 0 ? 1 : times, letter);
    }
    return letters;
}

class KernelBuilder {
  public:
    explicit KernelBuilder(ScriptedKernel& kernel) : kernel_(kernel) {}

    void add(CaseStatement& statement) {
        const std::string& keyword = statement.keyword;
        if (keyword == "kernel") {
            setUpMachine(statement);
        } else if (keyword == "task") {
            addTasks(statement);
        } else if (keyword == "map") {
            addMapping(statement);
        } else if (keyword == "cache") {
            for (ScriptedTask* task : tasks_) {
                task->sharedCache = dyld_shared_cache{
                    .uuid = {static_cast<std::uint8_t>(statement.number("uuid").value_or(1))},
                    .base_address = statement.number("base").value(),
                    .mapped_size = statement.number("size").value(),
                    .mapped_private = statement.flag("private")};
            }
        } else if (keyword == "image") {
            addImage(statement);
        } else if (keyword == "link") {
            const std::string link = takeWord(statement);
            const std::string target = takeWord(statement);
            for (ScriptedTask* task : tasks_) {
                task->resolvedPaths[link] = target;
            }
        } else if (keyword == "owned") {
            addOwnedObject(statement);
        } else if (keyword == "notice" || keyword == "machine-notice") {
            const std::string text = takeWord(statement);
            for (ScriptedTask* task : tasks_) {
                (keyword == "notice" ? task->notices.of_task : task->notices.of_machine).push_back(text);
            }
        } else if (keyword == "tag") {
            const std::string number = takeWord(statement);
            kernel_.tagDescriptions[static_cast<std::uint32_t>(caseNumber(number))] = takeWord(statement);
        } else if (keyword == "fail") {
            const std::string call = takeWord(statement);
            const int error = static_cast<int>(caseNumber(takeWord(statement)));
            kernel_.fail(call, error, takeSelector(statement));
        } else if (keyword == "ends") {
            addEnd(statement);
        } else if (keyword == "interrupt") {
            const std::string call = takeWord(statement);
            kernel_.before(
                call, [this_kernel = &kernel_] { this_kernel->interrupt(); }, takeSelector(statement));
        } else {
            throw std::invalid_argument("unknown keyword " + keyword);
        }
        statement.requireNothingLeft();
    }

  private:
    static std::string takeWord(CaseStatement& statement) {
        std::string word = statement.words.at(0);
        statement.words.erase(statement.words.begin());
        return word;
    }

    static CallSelector takeSelector(CaseStatement& statement) {
        CallSelector which{.nth = statement.number("nth").value_or(1)};
        const std::string times = statement.text("times").value_or("1");
        which.times = times == "always" ? always : caseNumber(times);
        which.pid = statement.number("pid");
        return which;
    }

    void addEnd(CaseStatement& statement) {
        const std::string call = takeWord(statement);
        const CallSelector which = takeSelector(statement);
        ScriptedTask* const task = kernel_.findTask(which.pid.value());
        kernel_.before(
            call, [task] { task->exit(); }, which);
    }

    void setUpMachine(CaseStatement& statement) {
        kernel_.effectiveUserId = static_cast<std::uint32_t>(statement.number("uid").value_or(0));
        kernel_.pageSize = statement.number("page-size").value_or(kernel_.pageSize);
        if (statement.flag("short-ids")) {
            kernel_.submapInfoCount = VM_REGION_SUBMAP_INFO_V1_COUNT_64;
        }
        if (const auto state = statement.text("switch")) {
            kernel_.selfRegionTally =
                *state == "absent" ? std::nullopt : std::optional(*state == "on" ? 1 : 0);
        }
    }

    void addTasks(CaseStatement& statement) {
        const std::string pids = takeWord(statement);
        const auto first = static_cast<std::int32_t>(std::stoi(pids));
        const std::size_t dash = pids.find('-', 1);
        const std::int32_t last = dash == std::string::npos ? first : std::stoi(pids.substr(dash + 1));
        TaskRecord record{.name = takeWord(statement)};
        record.parent = static_cast<std::int32_t>(statement.number("parent").value_or(1));
        record.flags = static_cast<std::uint32_t>(statement.number("flags").value_or(PROC_FLAG_LP64));
        record.path = statement.text("path").value_or("");
        record.usage.ri_phys_tally = statement.number("tally").value_or(0);
        record.usage.ri_lifetime_max_phys_tally = statement.number("peak").value_or(0);
        record.usage.ri_resident_anonymous = statement.number("anonymous").value_or(0);
        record.ledger["page_table"] = static_cast<std::int64_t>(statement.number("page_table").value_or(0));
        record.portStatus = static_cast<kern_return_t>(statement.number("port").value_or(KERN_SUCCESS));
        record.dirtyFlags = static_cast<std::uint32_t>(statement.number("dirty").value_or(0));
        record.state = statement.flag("zombie") ? TaskState::zombie : TaskState::alive;
        if (statement.flag("no-owned-list")) {
            record.owned.reset();
        }
        tasks_.clear();
        for (record.pid = first; record.pid <= last; ++record.pid) {
            tasks_.push_back(&kernel_.addTask(record));
        }
    }

    /// "name@start+size" is a segment.
    void addImage(CaseStatement& statement) {
        RKSymbolOwner image{
            .path = takeWord(statement), .base_address = statement.number("base").value(), .segments = {}};
        while (!statement.words.empty()) {
            const std::string word = takeWord(statement);
            const std::size_t at = word.rfind('@');
            const std::size_t plus = word.rfind('+');
            image.segments.push_back({.start = caseNumber(word.substr(at + 1, plus - at - 1)),
                                      .size = caseNumber(word.substr(plus + 1)),
                                      .name = word.substr(0, at)});
        }
        for (ScriptedTask* task : tasks_) {
            task->images.push_back(image);
        }
    }

    /// "9,0*100,0x10": raw dispositions, one of them a hundred times.
    static PageStates pagesOf(CaseStatement& statement, const std::string& key) {
        if (const auto letters = statement.text(key)) {
            return repeatedLetters(*letters);
        }
        std::vector<std::int32_t> words;
        std::istringstream numbers(statement.text(key + "-words").value_or(""));
        for (std::string number; std::getline(numbers, number, ',');) {
            const std::size_t star = number.find('*');
            const std::size_t times = star == std::string::npos ? 1 : std::stoul(number.substr(star + 1));
            words.insert(words.end(), times, static_cast<std::int32_t>(caseNumber(number.substr(0, star))));
        }
        return words;
    }

    void addMapping(CaseStatement& statement) {
        ScriptedMapping mapping{.start = statement.number("start")};
        mapping.size = statement.number("size").value_or(0);
        mapping.tag = static_cast<std::uint32_t>(statement.number("tag").value_or(0));
        mapping.pages = pagesOf(statement, "pages");
        if (const auto counts = statement.text("counts")) {
            PageCounts& told = mapping.pages.counts.emplace();
            char comma = 0;
            std::istringstream(*counts) >> told.resident >> comma >> told.dirtied >> comma >> told.reusable >>
                comma >> told.swapped;
        }
        if (const PageStates pages = pagesOf(statement, "object-pages"); pages.length() != 0) {
            mapping.objectPages = pages;
        }
        mapping.object = statement.number("object");
        mapping.offset = statement.number("offset").value_or(0);
        if (const auto mode = statement.number("share")) {
            mapping.shareMode = static_cast<std::uint8_t>(*mode);
        }
        mapping.file = statement.text("file").value_or("");
        if (const auto external = statement.number("external")) {
            mapping.externalPager = *external != 0;
        }
        mapping.purgeable = static_cast<int>(statement.number("purgeable").value_or(VM_PURGABLE_DENY));
        mapping.purgeableStatus =
            static_cast<kern_return_t>(statement.number("purgeable-fails").value_or(KERN_SUCCESS));
        mapping.wiredCount = statement.flag("wired") ? 1 : 0;
        open_.push_back({mapping, statement.number("submap").value_or(0)});
        for (; !open_.empty() && open_.back().missing == 0;
             open_.pop_back()) { // whole, with all that it holds
            const ScriptedMapping& whole = open_.back().mapping;
            if (open_.size() > 1) {
                open_[open_.size() - 2].mapping.nested.push_back(whole);
                --open_[open_.size() - 2].missing;
                continue;
            }
            for (ScriptedTask* task : tasks_) {
                task->map(whole);
            }
        }
    }

    void addOwnedObject(CaseStatement& statement) {
        const auto size = [&](const char* key) { return statement.number(key).value_or(0); };
        const owned_vmobject object{
            .id = size("id"),
            .virtualSize = size("virtual"),
            .residentSize = size("resident"),
            .wiredSize = size("wired"),
            .reusableSize = size("reusable"),
            .compressedSize = size("swapped"),
            .noTally = statement.flag("no-tally"),
            .ledgerTag = static_cast<std::uint8_t>(size("tag")),
            .purgeable = static_cast<std::uint8_t>(size("purgeable")),
        };
        for (ScriptedTask* task : tasks_) {
            task->owned->push_back(object);
        }
    }

    ScriptedKernel& kernel_;
    std::vector<ScriptedTask*> tasks_; // those of the last task line
    struct Submap {
        ScriptedMapping mapping;
        std::uint64_t missing = 0; // mappings in it that are yet to come
    };
    std::vector<Submap> open_; // the outermost first
};

} // namespace

void buildKernel(ScriptedKernel& kernel, std::vector<CaseStatement> statements) {
    KernelBuilder builder(kernel);
    for (CaseStatement& statement : statements) {
        try {
            builder.add(statement);
        } catch (const std::exception& mistake) {
            throw std::runtime_error(statement.place + ": " + mistake.what());
        }
    }
}

} // namespace tally
