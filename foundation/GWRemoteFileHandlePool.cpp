#include "GWRemoteFileHandlePool.h"

std::shared_ptr<GWRemoteFileHandle> GWRemoteFileHandlePool::acquire(GWErrorPtr* error) {
    for (auto& slot : idle_) {
        if (GWRemoteFileHandle* handle = slot.exchange(nullptr)) {
            // Not an owner: the pool keeps every handle it made.
            return std::shared_ptr<GWRemoteFileHandle>(std::shared_ptr<GWRemoteFileHandle>(),
                                                       handle);
        }
    }
    auto handle = GWRemoteFileHandle::initForReadingFromURL(url_, error);
    if (!handle) {
        return nullptr;
    }
    std::lock_guard lock(mutex_);
    owned_.push_back(handle);
    return std::shared_ptr<GWRemoteFileHandle>(std::shared_ptr<GWRemoteFileHandle>(), handle.get());
}

void GWRemoteFileHandlePool::release(const std::shared_ptr<GWRemoteFileHandle>& handle) {
    // With every slot taken the handle stays owned, unused, until the pool goes.
    for (auto& slot : idle_) {
        GWRemoteFileHandle* empty = nullptr;
        if (handle && slot.compare_exchange_strong(empty, handle.get())) {
            return;
        }
    }
}
