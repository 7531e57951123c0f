#pragma once

#include <stddef.h>
#include <stdint.h>

namespace kelvo {

// Opening and querying the kernel statistics devices, with uniform error
// lines. Every operation of KelvoDevice and DpmDevice opens its device,
// issues one request and closes it again.

// Opens the device read-only. Returns the descriptor, or -10 after
// "Failed to open <path>: <error>".
int openDevice(const char* path, int flags);

// Issues one request with an argument of exactly size bytes (the request
// number's own size bits are not trusted: some do not match the layout).
// 0 on success; -10 for a negative descriptor, -14 when the request fails.
int queryDevice(int fd, uint32_t request, void* arg, size_t size);

void closeDevice(int fd);

} // namespace kelvo

namespace kelvo {

// One whole operation: open the device, issue the request, close it. Returns
// 0; -10 after "Failed to open device: <path>" when it cannot be opened; -2
// after the operation's own failure line when the request fails. The file and
// function name the lines (see DEVICE_REQUEST).
int requestDevice(const char* file, const char* func, const char* path, uint32_t request,
                  void* arg, size_t size, const char* failure);

} // namespace kelvo

#define DEVICE_REQUEST(path, request, arg, size, failure) \
    ::kelvo::requestDevice(KELVO_FILE_NAME, __func__, path, request, arg, size, failure)
