#pragma once

#include <glob.h>

namespace TERN::HA::Daemon {

// The sorted paths that match a pattern.
class PathGlob {
 public:
    explicit PathGlob(const char* pattern) : _paths(), _matched(glob64(pattern, 0, nullptr, &_paths) == 0) {}
    ~PathGlob() { globfree64(&_paths); }

    PathGlob(const PathGlob&) = delete;
    PathGlob& operator=(const PathGlob&) = delete;

    // False when nothing matched or the search failed.
    bool matched() const { return _matched; }
    char** begin() const { return _paths.gl_pathv; }
    char** end() const { return _paths.gl_pathv + _paths.gl_pathc; }

 private:
    glob64_t _paths;
    bool _matched;
};

}  // namespace TERN::HA::Daemon
