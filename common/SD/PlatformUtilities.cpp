#include <SD/PlatformUtilities.h>

#include <HGLog/HGLogger.h>

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
    // The descriptor the library was checked and loaded through. Kept open
    // while the library is, so that no other library is loaded under the same
    // /proc/self/fd name while this one holds it.
    int descriptor;
};

namespace {

constexpr int LEVEL_FAILURE = 6000;
constexpr int LEVEL_WARNING = 4000;
constexpr int LEVEL_PROGRESS = 3000;

char const* const kTrustVariable = "IC_PLUGIN_TRUST";

// An installation can be relocated without rebuilding: the environment wins
// when it says something, and is consulted on every call so that a host may
// change it while running.
std::string fromEnvironment(char const* variable, char const* fallback)
{
    char const* value = std::getenv(variable);
    return (value != nullptr && *value != '\0') ? std::string(value) : std::string(fallback);
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

// What the walk found: the file's descriptor (O_PATH) and its status.
struct CheckedFile {
    Descriptor fd;
    struct stat st {};
};

// Walks the link-free absolute path from "/" one component at a time, each
// opened relative to the directory checked just before and without following
// links, so that what is checked is exactly the chain that leads to the
// returned descriptor. O_PATH opens nothing: a FIFO does not block and a
// device sees no open. With enforce false only the file type is checked.
bool openChecked(std::string const& resolved, bool enforce, CheckedFile& out, std::string& reason)
{
    std::vector<std::string> names;
    for (std::size_t pos = 0; pos < resolved.size();) {
        std::size_t const slash = resolved.find('/', pos);
        std::size_t const end = slash == std::string::npos ? resolved.size() : slash;
        if (end > pos)
            names.push_back(resolved.substr(pos, end - pos));
        pos = end + 1;
    }
    if (names.empty()) {
        reason = "not a regular file";
        return false;
    }

    Descriptor dir(::open("/", O_PATH | O_DIRECTORY | O_CLOEXEC));
    struct stat dirStat {};
    if (!dir.valid() || ::fstat(dir.get(), &dirStat) != 0) {
        reason = "/: " + errorText(errno);
        return false;
    }
    std::string dirPath = "/";
    for (std::size_t i = 0; i < names.size(); ++i) {
        bool const last = i + 1 == names.size();
        std::string const path = childPath(dirPath, names[i]);
        int const flags = O_PATH | O_NOFOLLOW | O_CLOEXEC | (last ? 0 : O_DIRECTORY);
        Descriptor next(::openat(dir.get(), names[i].c_str(), flags));
        struct stat st {};
        if (!next.valid() || ::fstat(next.get(), &st) != 0) {
            // The path was resolved a moment ago: whatever fails now was
            // changed in between, or cannot be searched.
            reason = path + ": " + errorText(errno);
            return false;
        }
        if (enforce && !directoryTrusted(dirPath, dirStat, path, st, reason))
            return false;
        if (!last) {
            if (!S_ISDIR(st.st_mode)) {
                reason = path + ": " + errorText(ENOTDIR);
                return false;
            }
            dir = std::move(next);
            dirStat = st;
            dirPath = path;
            continue;
        }
        // Opening a FIFO would block, and a directory or device is never a
        // library.
        if (!S_ISREG(st.st_mode)) {
            reason = "not a regular file";
            return false;
        }
        if (enforce && !fileTrusted(path, st, reason))
            return false;
        out.fd = std::move(next);
        out.st = st;
        return true;
    }
    return false; // not reached: the last component returns
}

std::string descriptorName(int fd)
{
    return "/proc/self/fd/" + std::to_string(fd);
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

// Whether the object behind a loader handle was mapped from the file st
// describes: the mapping that holds its dynamic section names the device and
// inode.
bool mappedFrom(void* library, struct stat const& st)
{
    struct link_map* map = nullptr;
    if (dlinfo(library, RTLD_DI_LINKMAP, &map) != 0 || map == nullptr || map->l_ld == nullptr)
        return false;
    auto const address = reinterpret_cast<std::uintptr_t>(map->l_ld);
    std::ifstream maps("/proc/self/maps");
    std::string line;
    while (std::getline(maps, line)) {
        unsigned long long start = 0, end = 0, offset = 0, inode = 0;
        unsigned int major = 0, minor = 0;
        char perms[8] = {};
        if (std::sscanf(line.c_str(), "%llx-%llx %7s %llx %x:%x %llu", &start, &end, perms, &offset,
                        &major, &minor, &inode) != 7)
            continue;
        if (address < start || address >= end)
            continue;
        return makedev(major, minor) == st.st_dev && inode == st.st_ino;
    }
    return false;
}

// Reads exactly size bytes at offset.
bool readAt(int fd, void* buffer, std::size_t size, std::uint64_t offset)
{
    auto* bytes = static_cast<char*>(buffer);
    while (size > 0) {
        ssize_t const n = ::pread(fd, bytes, size, static_cast<off_t>(offset));
        if (n < 0 && errno == EINTR)
            continue;
        if (n <= 0)
            return false;
        bytes += n;
        size -= static_cast<std::size_t>(n);
        offset += static_cast<std::uint64_t>(n);
    }
    return true;
}

// Whether the library's run paths or dependencies use $ORIGIN, which the
// loader works out from the name it was given: through /proc/self/fd it
// would point into /proc. Anything it cannot read counts as no, and the
// loader then reports the file itself.
bool usesOrigin(int fd)
{
    ElfW(Ehdr) header;
    if (!readAt(fd, &header, sizeof header, 0) || std::memcmp(header.e_ident, ELFMAG, SELFMAG) != 0 ||
        header.e_ident[EI_CLASS] != (__ELF_NATIVE_CLASS == 64 ? ELFCLASS64 : ELFCLASS32) ||
        header.e_phentsize != sizeof(ElfW(Phdr)) || header.e_phnum == 0)
        return false;
    std::vector<ElfW(Phdr)> segments(header.e_phnum);
    if (!readAt(fd, segments.data(), segments.size() * sizeof(ElfW(Phdr)), header.e_phoff))
        return false;
    ElfW(Phdr) const* dynamic = nullptr;
    for (auto const& segment : segments)
        if (segment.p_type == PT_DYNAMIC)
            dynamic = &segment;
    constexpr std::size_t kMaxEntries = 4096;
    if (dynamic == nullptr || dynamic->p_filesz == 0 ||
        dynamic->p_filesz / sizeof(ElfW(Dyn)) > kMaxEntries)
        return false;
    std::vector<ElfW(Dyn)> entries(dynamic->p_filesz / sizeof(ElfW(Dyn)));
    if (!readAt(fd, entries.data(), entries.size() * sizeof(ElfW(Dyn)), dynamic->p_offset))
        return false;

    std::uint64_t table = 0;
    std::uint64_t tableSize = 0;
    std::vector<std::uint64_t> strings;
    for (auto const& entry : entries) {
        if (entry.d_tag == DT_NULL)
            break;
        if (entry.d_tag == DT_STRTAB)
            table = entry.d_un.d_ptr;
        else if (entry.d_tag == DT_STRSZ)
            tableSize = entry.d_un.d_val;
        else if (entry.d_tag == DT_RPATH || entry.d_tag == DT_RUNPATH || entry.d_tag == DT_NEEDED)
            strings.push_back(entry.d_un.d_val);
    }
    if (strings.empty() || tableSize == 0)
        return false;
    // The string table is given by address; the loadable segment holding it
    // says where that is in the file.
    std::uint64_t tableOffset = 0;
    bool found = false;
    for (auto const& segment : segments) {
        if (segment.p_type == PT_LOAD && table >= segment.p_vaddr &&
            table < segment.p_vaddr + segment.p_filesz) {
            tableOffset = table - segment.p_vaddr + segment.p_offset;
            found = true;
            break;
        }
    }
    constexpr std::uint64_t kMaxTable = 1u << 24;
    if (!found || tableSize > kMaxTable)
        return false;
    std::string text(static_cast<std::size_t>(tableSize), '\0');
    if (!readAt(fd, &text[0], text.size(), tableOffset))
        return false;
    for (std::uint64_t at : strings) {
        if (at >= text.size())
            continue;
        std::string const value = text.c_str() + at;
        if (value.find("$ORIGIN") != std::string::npos || value.find("${ORIGIN}") != std::string::npos)
            return true;
    }
    return false;
}

// The loader's message for the last failure, or the fallback text.
std::string loaderError(char const* fallback)
{
    char const* reason = dlerror();
    return reason != nullptr ? std::string(reason) : std::string(fallback);
}

// Loads the library through the name /proc/self/fd/<fd>, which the kernel
// resolves to the very file the descriptor holds. The loader finds a library
// that is already open by that name before it opens anything: a library
// closed since but still mapped (unique symbols, -z nodelete) may carry the
// name of a descriptor number now reused. Such a name is left for another
// number. On return fd is the descriptor actually used.
void* loadThroughDescriptor(Descriptor& fd, struct stat const& st, std::string& reason)
{
    constexpr int kAttempts = 64;
    for (int attempt = 0; attempt < kAttempts; ++attempt) {
        std::string const name = descriptorName(fd.get());
        dlerror();
        void* const holder = dlopen(name.c_str(), RTLD_LAZY | RTLD_LOCAL | RTLD_NOLOAD);
        if (holder == nullptr || mappedFrom(holder, st)) {
            dlerror();
            // RTLD_NOW: an unresolved symbol shows now, before any of the
            // library's constructors run, not as a crash at first call.
            // RTLD_LOCAL: plug-ins export the same names and must not see
            // each other's.
            void* const library = dlopen(name.c_str(), RTLD_NOW | RTLD_LOCAL);
            if (library == nullptr)
                reason = loaderError("unknown loader error");
            if (holder != nullptr)
                dlclose(holder);
            return library;
        }
        dlclose(holder);
        int const other = ::fcntl(fd.get(), F_DUPFD_CLOEXEC, fd.get() + 1);
        if (other < 0) {
            reason = errorText(errno);
            return nullptr;
        }
        fd.reset(other);
    }
    reason = "every descriptor name tried is held by another loaded library";
    return nullptr;
}

// Loads the library by its resolved path. With the checks on, every
// directory on that path was just found writable by root or the effective
// user only, so only they could have swapped the file since; what was mapped
// is compared with what was checked all the same.
void* loadThroughPath(std::string const& resolved, struct stat const& st, std::string& reason)
{
    dlerror();
    void* const library = dlopen(resolved.c_str(), RTLD_NOW | RTLD_LOCAL);
    if (library == nullptr) {
        reason = loaderError("unknown loader error");
        return nullptr;
    }
    if (!mappedFrom(library, st)) {
        dlclose(library);
        reason = "the file changed while it was being loaded";
        return nullptr;
    }
    return library;
}

} // namespace

char PlatformUtilities::getSeparator()
{
    return '/';
}

std::string PlatformUtilities::getBriscaDataDir()
{
    return fromEnvironment("IC_DATA_DIR", IC_DEFAULT_DATA_DIR);
}

std::string PlatformUtilities::getBriscaMIDir()
{
    return fromEnvironment("IC_MI_DIR", IC_DEFAULT_MI_DIR);
}

std::string PlatformUtilities::getBriscaFPDir()
{
    return fromEnvironment("IC_FP_DIR", IC_DEFAULT_FP_DIR);
}

_LibraryHandle* PlatformUtilities::loadLibrary(char const* path)
{
    if (path == nullptr) {
        SD_LOG(LEVEL_FAILURE, "Cannot load a library: no path given");
        return nullptr;
    }
    // Links are resolved first; what is checked, and loaded, is the file they
    // lead to, along the directories that hold it.
    std::unique_ptr<char, decltype(&std::free)> const real(realpath(path, nullptr), &std::free);
    if (!real) {
        int const error = errno;
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": ", errorText(error));
        return nullptr;
    }
    std::string const resolved = real.get();

    bool const enforce = !trustChecksOff();
    CheckedFile checked;
    std::string reason;
    if (!openChecked(resolved, enforce, checked, reason)) {
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": ", reason);
        return nullptr;
    }
    if (!enforce)
        SD_LOG(LEVEL_WARNING, "Plug-in trust checks are off (", kTrustVariable, "=off): loading ", path,
               " without checking its owners and permissions");

    // Reading the headers through /proc/self/fd also shows whether that name
    // can be used at all (it cannot without /proc).
    Descriptor readable(::open(descriptorName(checked.fd.get()).c_str(), O_RDONLY | O_CLOEXEC));
    bool const byDescriptor = readable.valid() && !usesOrigin(readable.get());
    readable.reset();

    void* library = nullptr;
    std::string usedName;
    if (byDescriptor) {
        library = loadThroughDescriptor(checked.fd, checked.st, reason);
        usedName = descriptorName(checked.fd.get());
    } else {
        library = loadThroughPath(resolved, checked.st, reason);
        usedName = resolved;
    }
    if (library == nullptr) {
        SD_LOG(LEVEL_FAILURE, "Cannot load library ", path, ": ", renamed(reason, usedName, path));
        return nullptr;
    }
    try {
        return new _LibraryHandle{library, path, usedName, checked.fd.release()};
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
    // Only now: the name /proc/self/fd/<n> stays reserved while it is loaded.
    if (handle->descriptor >= 0)
        ::close(handle->descriptor);
    delete handle;
}

} // namespace SD
