#include <SD/PlatformUtilities.h>

#include <HGLog/HGLogger.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <fstream>
#include <memory>
#include <new>
#include <string>
#include <system_error>
#include <vector>

#include <dlfcn.h>
#include <fcntl.h>
#include <link.h>
#include <strings.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

namespace {

std::string const sdLogger = "Helmgard.SD.PlatformUtilities";

} // namespace

#define SD_LOG(level, ...) HGLOG_EVENT("PlatformUtilities", sdLogger, level, __VA_ARGS__)

namespace SD {

struct _LibraryHandle {
    void* library;
    std::string path;
    // The name the loader knows the library by, which its messages use.
    std::string loadedAs;
};

namespace {

constexpr int LEVEL_FAILURE = 6000;
constexpr int LEVEL_WARNING = 4000;
constexpr int LEVEL_PROGRESS = 3000;

char const* const kTrustVariable = "IC_PLUGIN_TRUST";

std::string resolvedPath(char const* path)
{
    std::unique_ptr<char, decltype(&std::free)> const real(realpath(path, nullptr), &std::free);
    return real ? std::string(real.get()) : std::string();
}

// The directory the installed library was loaded from, resolved; empty in
// the build tree or when the loader does not say.
std::string const& installedLibraryDirectory()
{
    static std::string const directory = [] {
        Dl_info info{};
        if (dladdr(reinterpret_cast<void*>(&PlatformUtilities::getSeparator), &info) == 0 ||
            info.dli_fname == nullptr)
            return std::string();
        std::string const file = resolvedPath(info.dli_fname);
        std::string const here = file.substr(0, file.rfind('/'));
        return here == resolvedPath(IC_BUILD_LIBDIR) ? std::string() : here;
    }();
    return directory;
}

// An installed library finds its directories relative to itself, wherever
// the installed tree was put; in the build tree, or for a directory
// configured outside the prefix, the configured path holds.
std::string installedDirectory(char const* fromLibraryDirectory, char const* configured)
{
    std::string const& here = installedLibraryDirectory();
    if (*fromLibraryDirectory == '\0' || here.empty())
        return configured;
    std::string directory = here;
    // Lexically: "lib/../var" becomes "var", so that texts show a plain path.
    for (char const* part = fromLibraryDirectory; *part != '\0';) {
        char const* const end = std::strchr(part, '/');
        std::string const name(part, end ? static_cast<std::size_t>(end - part) : std::strlen(part));
        if (name == "..")
            directory.erase(std::max<std::size_t>(directory.rfind('/'), 1));
        else if (!name.empty() && name != ".")
            directory += (directory == "/" ? "" : "/") + name;
        part = end ? end + 1 : part + name.size();
    }
    return directory;
}

// The environment wins when it says something, and is consulted on every
// call so that a host may change it while running.
std::string fromEnvironment(char const* variable, char const* fromLibraryDirectory,
                            char const* configured)
{
    char const* value = std::getenv(variable);
    return (value != nullptr && *value != '\0') ? std::string(value)
                                                 : installedDirectory(fromLibraryDirectory, configured);
}

// Read on every load, like the directories, so that a developer can flip it
// without restarting the host. Anything but "off" keeps the checks.
bool trustChecksOff()
{
    char const* value = std::getenv(kTrustVariable);
    return value != nullptr && strcasecmp(value, "off") == 0;
}

std::string errorText(int error)
{
    return std::system_category().message(error);
}

// A descriptor closed when it goes out of scope.
class Descriptor {
public:
    explicit Descriptor(int fd = -1) : fd_(fd) {}
    ~Descriptor() { reset(); }
    Descriptor(Descriptor const&) = delete;
    Descriptor& operator=(Descriptor const&) = delete;
    Descriptor(Descriptor&& other) noexcept : fd_(other.release()) {}
    Descriptor& operator=(Descriptor&& other) noexcept
    {
        if (this != &other) {
            reset();
            fd_ = other.release();
        }
        return *this;
    }

    int get() const { return fd_; }
    bool valid() const { return fd_ >= 0; }
    int release()
    {
        int const fd = fd_;
        fd_ = -1;
        return fd;
    }
    void reset(int fd = -1)
    {
        if (fd_ >= 0)
            ::close(fd_);
        fd_ = fd;
    }

private:
    int fd_;
};

std::string modeText(mode_t mode)
{
    char text[8];
    std::snprintf(text, sizeof text, "%04o", static_cast<unsigned int>(mode & 07777));
    return text;
}

// Root can change any file anyway, and the effective user is the one the
// process already trusts with its own code; nobody else may own a link in
// the chain.
bool trustedOwner(struct stat const& st)
{
    return st.st_uid == 0 || st.st_uid == geteuid();
}

std::string ownerText(struct stat const& st)
{
    return "owned by uid " + std::to_string(st.st_uid) + ", not by root or the effective user";
}

std::string childPath(std::string const& dir, std::string const& name)
{
    return dir == "/" ? dir + name : dir + "/" + name;
}

// Whether a directory of the chain may hold the next component: nobody but
// root or the effective user can rename, replace or remove entries in it.
// One that others may write to is accepted only with the sticky bit (like
// /tmp), where only an entry's owner can move it, and then only when that
// entry belongs to root or the effective user.
bool directoryTrusted(std::string const& dir, struct stat const& dirStat,
                      std::string const& child, struct stat const& childStat,
                      std::string& reason)
{
    if (!trustedOwner(dirStat)) {
        reason = "not trusted: directory " + dir + " is " + ownerText(dirStat);
        return false;
    }
    if ((dirStat.st_mode & (S_IWGRP | S_IWOTH)) == 0)
        return true;
    if ((dirStat.st_mode & S_ISVTX) == 0) {
        reason = "not trusted: directory " + dir +
                 " is writable by group or others without the sticky bit (mode " +
                 modeText(dirStat.st_mode) + ")";
        return false;
    }
    if (!trustedOwner(childStat)) {
        reason = "not trusted: " + child + " in the shared directory " + dir + " is " +
                 ownerText(childStat);
        return false;
    }
    return true;
}

bool fileTrusted(std::string const& file, struct stat const& st, std::string& reason)
{
    if (!trustedOwner(st)) {
        reason = "not trusted: " + file + " is " + ownerText(st);
        return false;
    }
    if ((st.st_mode & (S_IWGRP | S_IWOTH)) != 0) {
        reason = "not trusted: " + file + " is writable by group or others (mode " +
                 modeText(st.st_mode) + ")";
        return false;
    }
    return true;
}

// The chain from "/" to the file as it was walked: every component opened
// relative to the one before without following links, so that what is
// judged is exactly the chain that leads to the file.
struct Chain {
    std::vector<std::string> paths; // "/", then each directory reached
    std::vector<struct stat> stats;
};

struct Walk {
    Walk() = default;
    Walk(Walk const&) = delete; // dirs may point into the walk itself
    Walk& operator=(Walk const&) = delete;

    Chain own;                // the directories, when walked here
    Chain const* dirs = &own; // the directories judged: own, or a scan's
    Descriptor ownDir;        // the file's directory (O_PATH), unless a scan holds it
    int dir = -1;             // the file's directory, whoever holds it
    std::string name;         // the file's name in it
    std::string file;         // its path, once its status was taken
    struct stat fileStat {};
    bool reached = false;     // the file's status was taken
    bool complete = false;    // and it is a regular file
};

// Splits an absolute path into its names; false when one of them is "." or
// "..", which only a resolved path may skip.
bool splitNames(std::string const& path, std::vector<std::string>& names)
{
    for (std::size_t pos = 0; pos < path.size();) {
        std::size_t const slash = path.find('/', pos);
        std::size_t const end = slash == std::string::npos ? path.size() : slash;
        if (end > pos) {
            names.push_back(path.substr(pos, end - pos));
            if (names.back() == "." || names.back() == "..")
                return false;
        }
        pos = end + 1;
    }
    return true;
}

// Takes the status of the file in the walked directory, without opening it.
bool finishWalk(Walk& walk, std::string const& name, std::string& reason)
{
    walk.file = childPath(walk.dirs->paths.back(), name);
    if (::fstatat(walk.dir, name.c_str(), &walk.fileStat, AT_SYMLINK_NOFOLLOW) != 0) {
        reason = walk.file + ": " + errorText(errno);
        return false;
    }
    walk.reached = true;
    // Opening a FIFO would block, and a directory or device is never a
    // library.
    if (!S_ISREG(walk.fileStat.st_mode)) {
        reason = "not a regular file";
        return false;
    }
    walk.name = name;
    walk.complete = true;
    return true;
}

// Opens every directory of the path with O_PATH (which opens nothing: a FIFO
// does not block and a device sees no open) and takes the file's status
// without opening it at all. Stops at the first component that cannot be
// reached, is a link, or is of the wrong type; reason says which. The
// statuses gathered so far are kept either way, so that a refusal found on
// the way can be judged first.
bool walkPath(std::string const& file, Walk& walk, std::string& reason)
{
    std::vector<std::string> names;
    if (!splitNames(file, names) || names.empty()) {
        reason = "not a regular file";
        return false;
    }
    Descriptor dir(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    struct stat st {};
    if (!dir.valid() || ::fstat(dir.get(), &st) != 0) {
        reason = "/: " + errorText(errno);
        return false;
    }
    Chain& chain = walk.own;
    chain.paths.reserve(names.size());
    chain.stats.reserve(names.size());
    chain.paths.emplace_back("/");
    chain.stats.push_back(st);
    for (std::size_t i = 0; i + 1 < names.size(); ++i) {
        std::string path = childPath(chain.paths.back(), names[i]);
        Descriptor next(::openat(dir.get(), names[i].c_str(),
                                 O_PATH | O_NOFOLLOW | O_DIRECTORY | O_CLOEXEC));
        if (!next.valid() || ::fstat(next.get(), &st) != 0) {
            // A resolved path has no links: whatever fails now was changed
            // since, or cannot be searched.
            reason = path + ": " + errorText(errno);
            return false;
        }
        chain.paths.push_back(std::move(path));
        chain.stats.push_back(st);
        dir = std::move(next);
    }
    walk.ownDir = std::move(dir);
    walk.dir = walk.ownDir.get();
    return finishWalk(walk, names.back(), reason);
}

// Judges the components reached, in order: each directory for the entry
// below it, then the file itself.
bool chainTrusted(Walk const& walk, std::string& reason)
{
    Chain const& chain = *walk.dirs;
    for (std::size_t i = 1; i < chain.stats.size(); ++i)
        if (!directoryTrusted(chain.paths[i - 1], chain.stats[i - 1], chain.paths[i], chain.stats[i], reason))
            return false;
    if (!walk.reached)
        return true;
    return directoryTrusted(chain.paths.back(), chain.stats.back(), walk.file, walk.fileStat, reason) &&
           (!walk.complete || fileTrusted(walk.file, walk.fileStat, reason));
}

// Replaces each occurrence of name that ends where a name ends in the
// loader's messages (before ':' or at the end), so that they speak of the
// file the caller asked for.
std::string renamed(std::string text, std::string const& name, std::string const& shown)
{
    if (name.empty() || name == shown)
        return text;
    std::size_t pos = 0;
    while ((pos = text.find(name, pos)) != std::string::npos) {
        std::size_t const end = pos + name.size();
        if (end == text.size() || text[end] == ':') {
            text.replace(pos, name.size(), shown);
            pos += shown.size();
        } else {
            pos = end;
        }
    }
    return text;
}

// The kernel's answer, by address, to which file backs a mapping (Linux
// 6.11 and later; the system headers may predate it).
struct MappingQuery {
    std::uint64_t size, flags, address, start, end, vmaFlags, pageSize, offset, inode;
    std::uint32_t devMajor, devMinor, nameSize, buildIdSize;
    std::uint64_t nameAddress, buildIdAddress;
};
static_assert(sizeof(MappingQuery) == 104, "the kernel's struct procmap_query");
constexpr unsigned long kProcmapQuery = _IOWR('f', 17, MappingQuery);

enum class Mapped { fromFile, fromOther, unknown };

// The same question answered from the text of /proc/self/maps, for kernels
// without the query.
Mapped mappedFromText(std::uintptr_t address, struct stat const& st)
{
    std::ifstream maps("/proc/self/maps");
    std::string line;
    while (std::getline(maps, line)) {
        unsigned long long start = 0, end = 0, offset = 0, inode = 0;
        unsigned int major = 0, minor = 0;
        char perms[8] = {};
        if (std::sscanf(line.c_str(), "%llx-%llx %7s %llx %x:%x %llu", &start, &end, perms, &offset,
                        &major, &minor, &inode) == 7 &&
            address >= start && address < end)
            return makedev(major, minor) == st.st_dev && inode == st.st_ino ? Mapped::fromFile
                                                                              : Mapped::fromOther;
    }
    return Mapped::unknown;
}

// Whether the object behind a loader handle was mapped from the file st
// describes: the mapping that holds its dynamic section names the device and
// inode. maps is an open /proc/self/maps, or invalid when there is none.
Mapped mappedFrom(void* library, struct stat const& st, int maps)
{
    struct link_map* map = nullptr;
    if (dlinfo(library, RTLD_DI_LINKMAP, &map) != 0 || map == nullptr || map->l_ld == nullptr)
        return Mapped::unknown;
    auto const address = reinterpret_cast<std::uintptr_t>(map->l_ld);
    MappingQuery query{};
    query.size = sizeof query;
    query.address = address;
    if (maps < 0 || ::ioctl(maps, kProcmapQuery, &query) != 0)
        return maps >= 0 && errno == ENOENT ? Mapped::unknown : mappedFromText(address, st);
    return makedev(query.devMajor, query.devMinor) == st.st_dev && query.inode == st.st_ino
               ? Mapped::fromFile
               : Mapped::fromOther;
}

// The loader's message for the last failure, or the fallback text.
std::string loaderError(char const* fallback)
{
    char const* reason = dlerror();
    return reason != nullptr ? std::string(reason) : std::string(fallback);
}

// Whether an object the loader holds is known by name. The loader looks a
// name up among the objects it holds before it opens anything: a library
// closed since but still mapped (unique symbols, -z nodelete) keeps its name
// after its file was replaced. Looking costs no system call.
bool nameHeld(std::string const& name)
{
    return dl_iterate_phdr(
               [](struct dl_phdr_info* info, std::size_t, void* wanted) {
                   return info->dlpi_name != nullptr &&
                                  *static_cast<std::string const*>(wanted) == info->dlpi_name
                              ? 1
                              : 0;
               },
               const_cast<std::string*>(&name)) != 0;
}

// Loads the judged file by its path, under which the loader, debuggers and
// $ORIGIN then know it, and keeps it only when the object the loader mapped
// is the judged inode. An object that stays mapped under that name after the
// close of a mismatch is one the loader held before (from a file since
// replaced), not a file swapped in now: the name is then spelled anew
// ("dir/./name") so that the loader opens the file. On return name is the
// name the loader knows the library by.
void* loadJudged(std::string& name, struct stat const& st, int maps, bool enforce, std::string& reason)
{
    constexpr int kAttempts = 8;
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        dlerror();
        // RTLD_NOW: an unresolved symbol shows now, before any of the
        // library's constructors run, not as a crash at first call.
        // RTLD_LOCAL: plug-ins export the same names and must not see each
        // other's.
        void* const library = dlopen(name.c_str(), RTLD_NOW | RTLD_LOCAL);
        if (library == nullptr) {
            reason = loaderError("unknown loader error");
            return nullptr;
        }
        Mapped const mapped = mappedFrom(library, st, maps);
        if (mapped == Mapped::fromFile || (mapped == Mapped::unknown && !enforce))
            return library;
        dlclose(library);
        if (mapped == Mapped::unknown) {
            reason = "cannot tell which file the loader mapped (no /proc/self/maps)";
            return nullptr;
        }
        // Still held after this close: an object that stays mapped.
        if (!nameHeld(name)) {
            reason = "the file changed while it was being loaded";
            return nullptr;
        }
        name.insert(name.rfind('/') + 1, "./");
    }
    reason = "every name tried is held by another loaded library";
    return nullptr;
}

} // namespace

// What a scan remembers: the directory chain walked for the last directory
// it saw, and that directory's descriptor.
struct PlatformUtilities::Scan::State {
    std::string directory; // as the caller spelled it
    Chain chain;
    Descriptor dir;
    Descriptor maps; // /proc/self/maps, asked which file each library came from
};

namespace {

// The innermost scan of this thread.
thread_local PlatformUtilities::Scan* currentScan = nullptr;

// Walks a link-free absolute path, reusing the chain the scan holds when the
// file lies in its directory, and leaving the chain of a new directory to it.
bool walkInScan(PlatformUtilities::Scan::State* scan, std::string const& file, Walk& walk,
                std::string& reason)
{
    std::size_t const slash = file.rfind('/');
    if (scan != nullptr && scan->dir.valid() && slash == scan->directory.size() &&
        file.compare(0, slash, scan->directory) == 0) {
        std::string const name = file.substr(slash + 1);
        if (name.empty() || name == "." || name == "..")
            return false;
        walk.dirs = &scan->chain;
        walk.dir = scan->dir.get();
        return finishWalk(walk, name, reason);
    }
    bool const walked = walkPath(file, walk, reason);
    if (scan != nullptr && walk.ownDir.valid()) {
        scan->directory = file.substr(0, slash);
        scan->chain = std::move(walk.own);
        walk.dirs = &scan->chain;
        scan->dir = std::move(walk.ownDir);
    }
    return walked;
}

} // namespace

PlatformUtilities::Scan::Scan() : state_(new State), outer_(currentScan)
{
    currentScan = this;
}

PlatformUtilities::Scan::~Scan()
{
    currentScan = outer_;
    delete state_;
}

char PlatformUtilities::getSeparator()
{
    return '/';
}

std::string PlatformUtilities::getBriscaDataDir()
{
    return fromEnvironment("IC_DATA_DIR", IC_DATA_DIR_FROM_LIBDIR, IC_DEFAULT_DATA_DIR);
}

std::string PlatformUtilities::getBriscaMIDir()
{
    return fromEnvironment("IC_MI_DIR", IC_MI_DIR_FROM_LIBDIR, IC_DEFAULT_MI_DIR);
}

std::string PlatformUtilities::getBriscaFPDir()
{
    return fromEnvironment("IC_FP_DIR", IC_FP_DIR_FROM_LIBDIR, IC_DEFAULT_FP_DIR);
}

std::string PlatformUtilities::getInstalledPath(char const* fromLibraryDirectory, char const* configured)
{
    return installedDirectory(fromLibraryDirectory ? fromLibraryDirectory : "", configured ? configured : "");
}

_LibraryHandle* PlatformUtilities::loadLibrary(char const* path)
{
    if (path == nullptr) {
        SD_LOG(LEVEL_FAILURE, "Cannot load a library: no path given");
        return nullptr;
    }
    bool const enforce = !trustChecksOff();
    std::string reason;
    // A path without links is walked as given. Otherwise links are resolved
    // first; what is checked, and loaded, is the file they lead to, along
    // the directories that hold it.
    PlatformUtilities::Scan::State* const scan = currentScan != nullptr ? currentScan->state_ : nullptr;
    Walk asGiven, asResolved;
    Walk* walk = &asGiven;
    std::size_t const length = std::strlen(path);
    if (path[0] != '/' || path[length - 1] == '/' || !walkInScan(scan, path, asGiven, reason)) {
        std::unique_ptr<char, decltype(&std::free)> const real(realpath(path, nullptr), &std::free);
        if (!real) {
            int const error = errno;
            SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": ", errorText(error));
            return nullptr;
        }
        walk = &asResolved;
        walkPath(real.get(), asResolved, reason);
    }
    // A refusal on the way is reported before whatever stopped the walk.
    if ((enforce && !chainTrusted(*walk, reason)) || !walk->complete) {
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": ", reason);
        return nullptr;
    }
    if (!enforce)
        SD_LOG(LEVEL_WARNING, "Plug-in trust checks are off (", kTrustVariable, "=off): loading ", path,
               " without checking its owners and permissions");
    walk->ownDir.reset();

    // Every directory down to the file was just found writable by root or
    // the effective user only: nobody else can replace the file before the
    // loader opens it. What the loader mapped is compared with what was
    // judged all the same.
    Descriptor ownMaps;
    if (scan == nullptr || !scan->maps.valid())
        ownMaps.reset(::open("/proc/self/maps", O_RDONLY | O_CLOEXEC));
    int const maps = ownMaps.valid() || scan == nullptr ? ownMaps.get() : scan->maps.get();
    std::string loadedAs = walk->file;
    void* const library = loadJudged(loadedAs, walk->fileStat, maps, enforce, reason);
    if (scan != nullptr && ownMaps.valid())
        scan->maps = std::move(ownMaps);
    if (library == nullptr) {
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": ", renamed(reason, loadedAs, path));
        return nullptr;
    }
    try {
        return new _LibraryHandle{library, path, loadedAs};
    } catch (std::bad_alloc const&) {
        dlclose(library);
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": out of memory");
        return nullptr;
    }
}

void* PlatformUtilities::loadSymbol(_LibraryHandle* handle, char* name)
{
    if (handle == nullptr || handle->library == nullptr || name == nullptr)
        return nullptr;
    dlerror();
    void* symbol = dlsym(handle->library, name);
    if (symbol == nullptr) {
        std::string const reason = loaderError("null address");
        SD_LOG(LEVEL_PROGRESS, "No symbol ", static_cast<char const*>(name), " in ",
               handle->path, ": ", renamed(reason, handle->loadedAs, handle->path));
    }
    return symbol;
}

void PlatformUtilities::unloadLibrary(_LibraryHandle* handle)
{
    if (handle == nullptr)
        return;
    if (handle->library != nullptr)
        dlclose(handle->library);
    delete handle;
}

} // namespace SD
