// Project quotas: a directory tree tagged with one project id, whose usage
// the file system keeps up to date (ext4 with the "project" feature mounted
// with prjquota, XFS mounted with pquota). Asking for a project's usage costs
// one system call, whatever the size of the tree.
//
// The directory a project is assigned to gets the inherit flag, so everything
// created below it afterwards joins the project; items that were already
// there keep their own id. Renaming an item into a project directory from
// another project fails with EXDEV on both file systems.
//
// Every function returns 0 or an errno value. Thread-safe: no state.
#pragma once

#include <cstdint>
#include <string>

namespace tarn {

struct ProjectQuotaUsage {
    uint64_t bytes = 0;   // space charged to the project
    uint64_t inodes = 0;  // files and directories in it
};

// Usage of project `projectID` on the file system holding `path`. ESRCH
// when project quotas are not on there, ENOSYS when the kernel has no quota
// support; EINVAL/ENOTTY-like answers from file systems without quotas.
int ProjectQuotaUsageOf(const std::string& path, uint32_t projectID, ProjectQuotaUsage* usage);

// A project id that nothing on the file system of `path` uses yet, tried
// from `seed` on (spread over the ids above the ones administrators usually
// hand out). Fails like ProjectQuotaUsageOf() when the file system keeps no
// project usage, EEXIST when every id tried is taken. Callers serialise
// choosing and assigning, or two may get the same id.
int ProjectQuotaChooseID(const std::string& path, uint32_t seed, uint32_t* projectID);

// Gives `path` (never followed if a link) project id `projectID`, and a
// directory the inherit flag. EOPNOTSUPP/ENOTTY when the file system has no
// project ids.
int ProjectQuotaAssign(const std::string& path, uint32_t projectID);

// The project id of `path` and whether its directory passes it on.
int ProjectQuotaRead(const std::string& path, uint32_t* projectID, bool* inherits);

}  // namespace tarn
