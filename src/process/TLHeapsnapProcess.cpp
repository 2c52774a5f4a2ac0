#include "process/TLHeapsnapProcess.h"

#include "platform/quarry.h"

#include <cerrno>
#include <cstdint>
#include <exception>
#include <filesystem>
#include <fstream>
#include <system_error>

namespace tally {

using namespace platform;

namespace {

/// The whole of a file; only of a regular one, since others may never end.
std::string contentsOfFile(const std::string& path, std::error_code& failure) {
    const auto status = std::filesystem::status(path, failure);
    if (failure) {
        return {};
    }
    if (!std::filesystem::is_regular_file(status)) {
        failure = std::make_error_code(std::filesystem::is_directory(status) ? std::errc::is_a_directory
                                                                             : std::errc::invalid_argument);
        return {};
    }
    const std::uintmax_t size = std::filesystem::file_size(path, failure);
    if (failure) {
        return {};
    }
    std::string contents;
    try {
        contents.resize(size);
    } catch (const std::exception&) { // a sparse file can say any size
        failure = std::make_error_code(std::errc::not_enough_memory);
        return {};
    }
    std::ifstream file(path, std::ios::binary);
    if (!file.read(contents.data(), static_cast<std::streamsize>(size))) {
        failure = std::error_code(errno, std::generic_category());
    }
    return contents;
}

} // namespace

std::shared_ptr<TLProcess> processWithHeapsnap(const std::string& path, std::optional<TLError>* error) {
    std::error_code failure;
    const std::string contents = contentsOfFile(path, failure);
    std::optional<TLError> reason;
    if (failure) {
        reason = TLError{failure.category().name(), failure.value(), failure.message()};
    } else {
        std::string message;
        const auto graph = QRYDirectedGraphWithData(contents, &message);
        // No kind of process is made of a snapshot's graph, so that one which can be read is refused as well.
        reason =
            TLError{TallyErrorDomain, 1,
                    graph || message.empty() ? "heapsnap initialization failed with unknown error" : message};
    }
    if (error != nullptr) {
        *error = std::move(reason);
    }
    return nullptr;
}

} // namespace tally
