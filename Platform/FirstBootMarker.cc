#include "Platform/FirstBootMarker.h"

#include <fcntl.h>
#include <semaphore.h>

#include <cerrno>
#include <cstdio>
#include <functional>

#include "Platform/RootPrefix.h"

namespace tarn {

std::string FirstBootMarkerName() {
    std::string name = "tarnkeeperd.fb_check";
    if (!RootIsSystemRoot()) {
        char buf[32];
        std::snprintf(buf, sizeof buf, ".%016zx", std::hash<std::string>{}(RootPrefix()));
        name += buf;
    }
    return name;
}

bool FirstBootMarkerExists() {
    sem_t* s = ::sem_open((std::string("/") + FirstBootMarkerName()).c_str(), 0);
    if (s == SEM_FAILED) return false;
    ::sem_close(s);
    return true;
}

int FirstBootMarkerCreate() {
    sem_t* s = ::sem_open((std::string("/") + FirstBootMarkerName()).c_str(), O_CREAT, 0444, 0);
    if (s == SEM_FAILED) return errno;
    ::sem_close(s);
    return 0;
}

int FirstBootMarkerRemove() {
    if (::sem_unlink((std::string("/") + FirstBootMarkerName()).c_str()) != 0 && errno != ENOENT) return errno;
    return 0;
}

}  // namespace tarn
