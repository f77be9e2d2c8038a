#include "root.h"

#include <fcntl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "refusal.h"

namespace fs = std::filesystem;

namespace sandbox {
namespace {

// The new root is built over /sys: it exists everywhere, and it is the one directory that the new root takes
// nothing from.
const std::string kNewRoot = "/sys";

// How many processes /proc lists by number. The numbers of a fresh pid namespace start at 1, and a test does
// not come near this.
constexpr int kListedProcesses = 500;

std::string inNewRoot(const std::string& path) {
    return kNewRoot + path;
}

void makeDirectory(const std::string& path, mode_t mode = 0755) {
    fs::create_directories(path);
    require(chmod(path.c_str(), mode) == 0, "cannot set the mode of " + path);
}

void makeSymlink(const std::string& target, const std::string& path) {
    require(symlink(target.c_str(), path.c_str()) == 0, "cannot link " + path);
}

void makeFile(const std::string& path, const std::string& text = {}) {
    std::ofstream file(path, std::ios::binary);
    file << text;
    file.close();
    require(file.good(), "cannot write " + path);
}

std::string contentOf(const std::string& path) {
    std::ifstream file(path, std::ios::binary);
    std::ostringstream content;
    content << file.rdbuf();
    return content.str();
}

void mountTmpfs(const std::string& path, const char* data) {
    fs::create_directories(path);
    require(mount("tmpfs", path.c_str(), "tmpfs", MS_NOSUID | MS_NODEV, data) == 0,
            "cannot mount a tmpfs on " + path);
}

void bindTree(const std::string& source, const std::string& target, bool writable) {
    require(mount(source.c_str(), target.c_str(), nullptr, MS_BIND | MS_REC, nullptr) == 0,
            "cannot bind " + source);
    if (!writable) {
        mount_attr attributes{};
        attributes.attr_set = MOUNT_ATTR_RDONLY;
        require(mount_setattr(AT_FDCWD, target.c_str(), AT_RECURSIVE, &attributes, sizeof attributes) == 0,
                "cannot make " + source + " read-only");
    }
}

void bindFile(const std::string& source, const std::string& target) {
    makeFile(target);
    require(mount(source.c_str(), target.c_str(), nullptr, MS_BIND, nullptr) == 0, "cannot bind " + source);
}

void bindDirectory(const std::string& source) {
    fs::create_directories(inNewRoot(source));
    bindTree(source, inNewRoot(source), false);
}

// Symbolic links stay what they are, so that /bin and /usr/bin remain one directory where they are one.
void takeSystemDirectory(const fs::path& source) {
    if (fs::is_symlink(source)) {
        makeSymlink(fs::read_symlink(source), inNewRoot(source));
    } else if (fs::is_directory(source)) {
        bindDirectory(source);
    }
}

// Every child of /usr by itself: a test can then make /usr/tern next to them.
void fillPrograms() {
    fs::create_directories(inNewRoot("/usr"));
    for (const auto& entry : fs::directory_iterator("/usr")) {
        if (entry.path() != "/usr/tern") {
            takeSystemDirectory(entry.path());
        }
    }
    for (const char* directory : {"/bin", "/sbin", "/lib", "/lib32", "/lib64", "/libx32"}) {
        takeSystemDirectory(directory);
    }
}

// Links and files are copies, so that a test can put its own time zone or hosts in their place.
void fillConfiguration() {
    mountTmpfs(inNewRoot("/etc"), "mode=0755");
    for (const auto& entry : fs::directory_iterator("/etc")) {
        const std::string path = entry.path();
        if (entry.is_symlink()) {
            makeSymlink(fs::read_symlink(path), inNewRoot(path));
        } else if (entry.is_directory()) {
            bindDirectory(path);
        } else if (entry.is_regular_file() && access(path.c_str(), R_OK) == 0) {
            makeFile(inNewRoot(path), contentOf(path));
        }
    }
}

// /tmp and /var are file systems of their own, as on an appliance: a rename between them fails.
void makeEmptyDirectories() {
    mountTmpfs(inNewRoot("/tmp"), "mode=1777");
    mountTmpfs(inNewRoot("/var"), "mode=0755");
    mountTmpfs(inNewRoot("/run"), "mode=0755");
    makeDirectory(inNewRoot("/var/log"));
    makeDirectory(inNewRoot("/var/tmp"), 01777);
    makeDirectory(inNewRoot("/root"), 0700);
    makeDirectory(inNewRoot("/home"));
}

void fillDevices() {
    mountTmpfs(inNewRoot("/dev"), "mode=0755");
    for (const char* device :
         {"/dev/null", "/dev/zero", "/dev/full", "/dev/random", "/dev/urandom", "/dev/tty"}) {
        bindFile(device, inNewRoot(device));
    }
    makeDirectory(inNewRoot("/dev/shm"), 01777);
    makeDirectory(inNewRoot("/dev/pts"));
    require(mount("devpts", inNewRoot("/dev/pts").c_str(), "devpts", MS_NOSUID | MS_NOEXEC,
                  "newinstance,ptmxmode=0666,mode=0620") == 0,
            "cannot mount devpts");
    makeSymlink("pts/ptmx", inNewRoot("/dev/ptmx"));
    makeSymlink("/proc/self/fd", inNewRoot("/dev/fd"));
    makeSymlink("/proc/self/fd/0", inNewRoot("/dev/stdin"));
    makeSymlink("/proc/self/fd/1", inNewRoot("/dev/stdout"));
    makeSymlink("/proc/self/fd/2", inNewRoot("/dev/stderr"));
}

void mountKernelProc() {
    const std::string proc = inNewRoot(kKernelProc);
    makeDirectory(proc);
    require(mount("proc", proc.c_str(), "proc", MS_NOSUID | MS_NODEV | MS_NOEXEC, nullptr) == 0,
            "cannot mount proc");
    // In a user namespace the trigger is out of reach already, and a masked proc would keep a sandbox inside
    // this one from mounting its own.
    const std::string trigger = proc + "/sysrq-trigger";
    if (access(trigger.c_str(), W_OK) == 0) {
        require(mount("/dev/null", trigger.c_str(), nullptr, MS_BIND, nullptr) == 0,
                "cannot mask " + trigger);
    }
}

bool isNumber(const std::string& text) {
    return text.find_first_not_of("0123456789") == std::string::npos;
}

// A /proc that tests can write to. Everything leads to the kernel's own, except for the files that are
// replaced (memory figures, the trigger for system requests) and those that only the host may read.
void fillProc() {
    mountTmpfs(inNewRoot("/proc"), "mode=0755");
    const std::string own[] = {"drbd", "kcore", "kmsg", "meminfo", "sysrq-trigger"};
    for (const auto& entry : fs::directory_iterator(inNewRoot(kKernelProc))) {
        const std::string name = entry.path().filename();
        if (!isNumber(name) && std::find(std::begin(own), std::end(own), name) == std::end(own)) {
            makeSymlink(kKernelProc + ("/" + name), inNewRoot("/proc/" + name));
        }
    }
    for (int process = 1; process <= kListedProcesses; ++process) {
        const std::string name = std::to_string(process);
        makeSymlink(kKernelProc + ("/" + name), inNewRoot("/proc/" + name));
    }
    makeFile(inNewRoot("/proc/meminfo"), contentOf(inNewRoot(kKernelProc) + "/meminfo"));
    makeFile(inNewRoot("/proc/sysrq-trigger"));
}

void fillSys() {
    mountTmpfs(inNewRoot("/sys"), "mode=0755");
    makeDirectory(inNewRoot("/sys/block"));
    makeDirectory(inNewRoot("/sys/class/ata_port"));
}

void bindTrees(std::vector<Bind>& binds) {
    // Parents first, or they would cover what lies inside them.
    std::stable_sort(binds.begin(), binds.end(),
                     [](const Bind& a, const Bind& b) { return a.directory < b.directory; });
    std::string marker;
    for (const Bind& bind : binds) {
        fs::create_directories(inNewRoot(bind.directory));
        bindTree(bind.directory, inNewRoot(bind.directory), bind.writable);
        marker += (bind.writable ? "rw " : "ro ") + bind.directory + "\n";
    }
    makeFile(inNewRoot(kMarker), marker);
}

void changeRoot() {
    require(chdir(kNewRoot.c_str()) == 0, "cannot enter the new root");
    require(syscall(SYS_pivot_root, ".", ".") == 0, "cannot change the root");
    // The old root now lies over the new one at the same place.
    require(umount2(".", MNT_DETACH) == 0, "cannot leave the old root");
    require(chdir("/") == 0, "cannot enter the root");
}

}  // namespace

std::vector<Bind> inheritedBinds() {
    std::vector<Bind> binds;
    std::ifstream marker(kMarker);
    std::string access;
    std::string directory;
    while (marker >> access && std::getline(marker.ignore(), directory)) {
        binds.push_back({directory, access == "rw"});
    }
    return binds;
}

void enterPrivateRoot(std::vector<Bind> binds) {
    umask(022);
    require(mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) == 0, "cannot make mounts private");
    mountTmpfs(kNewRoot, "mode=0755");
    mountKernelProc();
    fillPrograms();
    fillConfiguration();
    makeEmptyDirectories();
    fillDevices();
    fillProc();
    fillSys();
    bindTrees(binds);
    changeRoot();
}

}  // namespace sandbox
