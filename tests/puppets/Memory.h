// What puppets are made of: memory that is mapped, written and told of. Whatever fails ends the program.

#pragma once

#include <sys/mman.h>

#include <cstddef>
#include <string>

namespace puppets {

inline constexpr std::size_t page = 4096; // bytes
inline constexpr int readWrite = PROT_READ | PROT_WRITE;
inline constexpr int privateAnonymous = MAP_PRIVATE | MAP_ANONYMOUS;

[[noreturn]] void fail(const char* what);

/// Maps `size` bytes anywhere.
char* map(std::size_t size, int protection, int flags, int file = -1, off_t offset = 0);
/// Private anonymous memory that no neighbour merges with: between two inaccessible pages.
char* anonymous(std::size_t pages);
/// A file without a name on the disk below, all of whose pages are written back.
int makeFile(std::size_t pages);
int makeMemfd(const char* name, std::size_t pages);

/// Writes pages [first, first + count), each with contents of its own.
void write(char* address, std::size_t first, std::size_t count);
/// Reads a byte of each of these pages.
void touch(const char* address, std::size_t first, std::size_t count);

/// Prints a line of the ledger.
void tell(const char* name, const void* address, std::size_t pages, const std::string& figures);
/// A figure of such a line.
std::string figure(const char* key, std::size_t pages);
/// Says that the ledger is complete and waits until the input closes.
void holdStill();

} // namespace puppets
