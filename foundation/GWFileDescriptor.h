#pragma once

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <span>
#include <utility>

#include <GWArchiveSupport/GWFileDescriptor.h>

// Positioned I/O that finishes short transfers and retries interrupted ones.
// Reads stop early only at the end of the file; `got` says how far they came.
// Both return false with errno set on failure.
bool GWReadFully(int fd, std::uint64_t offset, std::span<std::uint8_t> into, std::size_t& got);
bool GWWriteFully(int fd, std::uint64_t offset, std::span<const std::uint8_t> bytes);
