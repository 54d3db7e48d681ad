// Keeps an application from running while its data is changed underneath it:
// holding the assertion makes the application-lifecycle service terminate the
// application and keep it from launching until invalidate().
//
// The application-lifecycle service is not present on Linux: construction
// logs that and answers an object that holds no assertion (callers go on
// unprotected, as they would on a platform without the service). The service
// is an interface so that a platform that has one, or a test, can plug it in.
//
// The constructor blocks its thread until the service has answered. The
// object must be invalidated before it is destroyed: destroying it while it
// still holds an assertion is a programming error and aborts.
#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>

namespace tarn {

enum TarnTerminationReason : int64_t {
    TarnTerminationReasonCritical = -1,
    TarnTerminationReasonInstallation = 0,
    TarnTerminationReasonCacheDeletion = 1,
};

// An assertion the service made; acquisition completes asynchronously.
class TarnTerminationAssertionHandle {
  public:
    virtual ~TarnTerminationAssertionHandle() = default;
    virtual void invalidate() = 0;
};

class TarnApplicationLifecycleService {
  public:
    virtual ~TarnApplicationLifecycleService() = default;
    // Makes an assertion for `bundleIdentifier`, or nullptr. `acquired` is
    // called exactly once for a made assertion, on any thread, with nullopt on
    // success or the failure's text.
    virtual std::unique_ptr<TarnTerminationAssertionHandle> terminationAssertionForBundleIdentifier(
        const std::string& bundleIdentifier, TarnTerminationReason reason,
        std::function<void(const std::optional<std::string>& failure)> acquired) = 0;
};

class TarnApplicationTerminationAssertion {
    struct PrivateTag {};

  public:
    // The platform's service; nullptr on Linux.
    static TarnApplicationLifecycleService* lifecycleService();
    // Tests: replaces the service (nullptr: not present).
    static void TEST_setLifecycleService(TarnApplicationLifecycleService* service);

    // The object once the assertion is held (or, without the service, an
    // object without one); nullptr when the assertion could not be had.
    static std::unique_ptr<TarnApplicationTerminationAssertion> initWithBundleIdentifier(
        const std::string& bundleIdentifier, TarnTerminationReason reason);

    explicit TarnApplicationTerminationAssertion(PrivateTag) {}
    ~TarnApplicationTerminationAssertion();
    TarnApplicationTerminationAssertion(const TarnApplicationTerminationAssertion&) = delete;
    TarnApplicationTerminationAssertion& operator=(const TarnApplicationTerminationAssertion&) =
        delete;

    void invalidate();
    TarnTerminationAssertionHandle* termAssertion() const { return termAssertion_.get(); }
    void setTermAssertion(std::unique_ptr<TarnTerminationAssertionHandle> termAssertion) {
        termAssertion_ = std::move(termAssertion);
    }

  private:
    std::unique_ptr<TarnTerminationAssertionHandle> termAssertion_;
};

}  // namespace tarn
