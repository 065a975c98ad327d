#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "foundation/GWError.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "xar/GWXARArchive.h"

namespace gwtest {

// A "file" element: id, name, type text ("file", "directory", ...), octal
// mode, and whatever else the test adds inside it.
std::string xarFileElement(int id, const std::string& name, const std::string& type,
                           const std::string& mode, const std::string& inner = "");

// Writes the archive into `directory` and opens it; fails the test when it
// does not open.
GWXARArchivePtr openBuiltXar(const XarBuilder& xar, const TemporaryDirectory& directory,
                             const std::string& name = "test.xar");

// Everything a data handler was told, call by call.
struct StreamCalls {
    struct Call {
        std::optional<GWData> data;
        bool isDone = false;
        bool checksumFailed = false;
        GWErrorPtr error;
    };
    std::vector<Call> calls;

    // The data of every call, joined.
    GWData bytes() const;
    const Call& last() const { return calls.back(); }
};

// A handler that records each call into `calls` and refuses the call with
// index `refuseAt` (never when negative).
GWXARDataHandler recordingHandler(StreamCalls& calls, int refuseAt = -1);

}  // namespace gwtest
