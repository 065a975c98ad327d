#include "XarExtractTestSupport.h"

#include <gtest/gtest.h>

namespace gwtest {

std::string xarFileElement(int id, const std::string& name, const std::string& type,
                           const std::string& mode, const std::string& inner) {
    return "<file id=\"" + std::to_string(id) + "\"><name>" + name + "</name><type>" + type +
           "</type><mode>" + mode + "</mode>" + inner + "</file>";
}

GWXARArchivePtr openBuiltXar(const XarBuilder& xar, const TemporaryDirectory& directory,
                             const std::string& name) {
    xar.write(directory.file(name));
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(directory.url(name), false, &error);
    EXPECT_TRUE(archive) << (error ? error->localizedDescription() : "no error");
    return archive;
}

GWData StreamCalls::bytes() const {
    GWData joined;
    for (const auto& call : calls) {
        if (call.data) {
            joined.insert(joined.end(), call.data->begin(), call.data->end());
        }
    }
    return joined;
}

GWXARDataHandler recordingHandler(StreamCalls& calls, int refuseAt) {
    return [&calls, refuseAt](std::optional<std::span<const std::uint8_t>> data, bool isDone,
                              bool checksumFailed, const GWErrorPtr& error) {
        StreamCalls::Call call;
        if (data) {
            call.data = GWData(data->begin(), data->end());
        }
        call.isDone = isDone;
        call.checksumFailed = checksumFailed;
        call.error = error;
        calls.calls.push_back(std::move(call));
        return int(calls.calls.size()) - 1 != refuseAt;
    };
}

}  // namespace gwtest
