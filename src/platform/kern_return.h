// Status codes and basic types of the kernel-shaped calls.

#pragma once

#include <cstdint>

namespace tally::platform {

using kern_return_t = int;
using mach_port_t = std::uint32_t; // the name of a port right; 0 is no port

inline constexpr mach_port_t MACH_PORT_NULL = 0;

inline constexpr kern_return_t KERN_SUCCESS = 0;
inline constexpr kern_return_t KERN_INVALID_ADDRESS = 1;      // nothing mapped at or above the address
inline constexpr kern_return_t KERN_NO_SPACE = 3;             // a kernel buffer could not be made
inline constexpr kern_return_t KERN_INVALID_ARGUMENT = 4;     // no such task, or it has ended
inline constexpr kern_return_t KERN_FAILURE = 5;              // the state could not be read
inline constexpr kern_return_t KERN_NO_ACCESS = 8;            // rights are missing
inline constexpr kern_return_t KERN_RIGHT_EXISTS = 21;        // somebody else has what only one can have
inline constexpr kern_return_t KERN_TERMINATED = 37;          // the task ended meanwhile
inline constexpr kern_return_t KERN_NOT_SUPPORTED = 46;       // this system has no such operation
inline constexpr kern_return_t KERN_OPERATION_TIMED_OUT = 49; // it did not happen in time

/// A readable text for `status`. Never empty.
const char* mach_error_string(kern_return_t status);

/// Writes "<label>: <mach_error_string(status)>" and a newline to standard error.
void mach_error(const char* label, kern_return_t status);

} // namespace tally::platform
