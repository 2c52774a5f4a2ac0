// The larger shapes of memory that a puppet can take on.

#pragma once

#include <cstddef>
#include <string>

namespace puppets {

/// One mapping of every kind of memory.
void zoo();
/// Forks `kids` children that share `pages` pages and change them in the way of `how`, which puppet.cpp
/// lists.
void family(std::size_t kids, std::size_t pages, const std::string& how);

} // namespace puppets
