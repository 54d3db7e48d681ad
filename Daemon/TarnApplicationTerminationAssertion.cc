#include "Daemon/TarnApplicationTerminationAssertion.h"

#include <atomic>
#include <cstdlib>
#include <semaphore>

#include "Daemon/TarnLog.h"

namespace tarn {

namespace {
std::atomic<TarnApplicationLifecycleService*> gLifecycleService{nullptr};
}  // namespace

TarnApplicationLifecycleService* TarnApplicationTerminationAssertion::lifecycleService() {
    return gLifecycleService.load();
}

void TarnApplicationTerminationAssertion::TEST_setLifecycleService(
    TarnApplicationLifecycleService* service) {
    gLifecycleService.store(service);
}

std::unique_ptr<TarnApplicationTerminationAssertion>
TarnApplicationTerminationAssertion::initWithBundleIdentifier(const std::string& bundleIdentifier,
                                                              TarnTerminationReason reason) {
    auto self = std::make_unique<TarnApplicationTerminationAssertion>(PrivateTag{});
    TarnApplicationLifecycleService* service = lifecycleService();
    if (!service) {
        TarnLog(
            kLogError, __func__,
            "Attempted to use termination assertions without the application-lifecycle service");
        return self;
    }
    // Shared with the callback, which may outlive a failed construction.
    struct Acquisition {
        std::binary_semaphore done{0};
        std::atomic<bool> failed{false};
    };
    auto acquisition = std::make_shared<Acquisition>();
    auto assertion = service->terminationAssertionForBundleIdentifier(
        bundleIdentifier, reason,
        [acquisition, bundleIdentifier](const std::optional<std::string>& failure) {
            if (failure) {
                TarnLog(kLogError, "initWithBundleIdentifier",
                        "Failed to acquire termination assertion for %@ : %@", bundleIdentifier,
                        *failure);
                acquisition->failed.store(true);
            }
            acquisition->done.release();
        });
    if (!assertion) {
        TarnLog(kLogError, __func__, "Failed to get application termination assertion");
        return nullptr;
    }
    acquisition->done.acquire();
    if (acquisition->failed.load()) {
        assertion->invalidate();
        return nullptr;
    }
    self->termAssertion_ = std::move(assertion);
    return self;
}

void TarnApplicationTerminationAssertion::invalidate() {
    if (termAssertion_) {
        termAssertion_->invalidate();
        termAssertion_.reset();
    }
}

TarnApplicationTerminationAssertion::~TarnApplicationTerminationAssertion() {
    if (termAssertion_) {
        TarnLog(kLogError, "~TarnApplicationTerminationAssertion",
                "Termination assertion released while still held");
        std::abort();
    }
}

}  // namespace tarn
