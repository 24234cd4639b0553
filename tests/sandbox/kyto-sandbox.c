/*
 * kyto-sandbox PROGRAM [ARGS...]
 *
 * Runs PROGRAM inside a disposable appliance root:
 *   - private mount namespace, a new pid namespace (the sandbox's init is our child;
 *     when it exits, every process left in the sandbox is killed by the kernel) and a
 *     network namespace of its own with only the loopback interface, up (tests serve
 *     and fetch on 127.0.0.1 and can reach nothing else);
 *   - an overlay file system whose lower layer is the host's "/" and whose upper layer
 *     lives on a scratch tmpfs that only this namespace sees, so every write vanishes;
 *   - fresh /proc with /proc/sys and /proc/sysrq-trigger read-only, read-only /sys, a
 *     private /dev (a few device nodes, devpts, shm), fresh and empty /run and /tmp;
 *     every read-only mount is read-only with everything mounted below it;
 *   - the test program and the provisioning script at their own paths, read-only, with
 *     what lies beside them (a build tree and its shared libraries, the source tree);
 *     when they live under /tmp or /run, only their top folder there is bound into the
 *     fresh folder, so /tmp holds nothing else;
 *   - a syslog catcher on /dev/log that appends each message as one line to
 *     /var/log/sandbox.syslog (backslash and newline escaped as \\ and \n);
 *   - the marker file /.kyto-sandbox, then the provisioning script, then PROGRAM with
 *     the working folder "/".
 *
 * Exit status: PROGRAM's exit status, 128 + signal when it was killed, 125 when the
 * sandbox could not be set up (PROGRAM never runs on the real root), 127 when PROGRAM
 * cannot be started.  Needs root.
 */
#define _GNU_SOURCE
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <net/if.h>
#include <sched.h>
#include <signal.h>
#include <stdarg.h>
#include <stdint.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/statvfs.h>
#include <sys/syscall.h>
#include <sys/types.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#ifndef KYTO_PROVISION_SCRIPT
#error "KYTO_PROVISION_SCRIPT must name the provisioning script"
#endif

#define SETUP_FAILED 125
#define EXEC_FAILED 127

static const char* const kNeeds =
    "needs root (CAP_SYS_ADMIN) and a kernel with overlayfs and mount, pid and network "
    "namespaces";

static volatile sig_atomic_t g_forward_pid = 0;

static void Fail(const char* hint, const char* fmt, ...)
    __attribute__((noreturn, format(printf, 2, 3)));

/* Prints "kyto-sandbox: cannot <what>: <strerror>" and a hint, then ends the run. */
static void Fail(const char* hint, const char* fmt, ...) {
    int err = errno;
    char what[PATH_MAX + 256];
    va_list ap;
    va_start(ap, fmt);
    vsnprintf(what, sizeof what, fmt, ap);
    va_end(ap);
    fprintf(stderr, "kyto-sandbox: cannot %s: %s\n", what, strerror(err));
    if (hint != NULL)
        fprintf(stderr, "kyto-sandbox: %s\n", hint);
    _exit(SETUP_FAILED);
}

static void ForwardSignal(int sig) {
    if (g_forward_pid > 0)
        kill((pid_t)g_forward_pid, sig);
}

static void InstallForwarding(void) {
    struct sigaction sa;
    memset(&sa, 0, sizeof sa);
    sa.sa_handler = ForwardSignal;
    sigemptyset(&sa.sa_mask);
    sigaction(SIGTERM, &sa, NULL);
    sigaction(SIGINT, &sa, NULL);
    sigaction(SIGHUP, &sa, NULL);
}

/* Waits for pid (reaping any other child on the way) and turns its end into an exit code. */
static int WaitFor(pid_t pid) {
    for (;;) {
        int status = 0;
        pid_t got = waitpid(-1, &status, 0);
        if (got < 0) {
            if (errno == EINTR)
                continue;
            Fail(NULL, "wait for process %d", (int)pid);
        }
        if (got != pid)
            continue;
        if (WIFEXITED(status))
            return WEXITSTATUS(status);
        if (WIFSIGNALED(status))
            return 128 + WTERMSIG(status);
    }
}

static void Path(char* out, const char* a, const char* b) {
    if ((size_t)snprintf(out, PATH_MAX, "%s%s", a, b) >= PATH_MAX) {
        errno = ENAMETOOLONG;
        Fail(NULL, "build path %s%s", a, b);
    }
}

static void Mount(const char* src, const char* dst, const char* type, unsigned long flags,
                  const char* data, const char* hint) {
    if (mount(src, dst, type, flags, data) != 0)
        Fail(hint, "mount %s on %s (%s)", src ? src : "-", dst, type ? type : "bind");
}

static void MakeDir(const char* path, mode_t mode) {
    if (mkdir(path, mode) != 0 && errno != EEXIST)
        Fail(NULL, "create folder %s", path);
}

/* mkdir -p; every folder created lies inside the overlay, never on the host. */
static void MakeDirs(const char* path) {
    char buf[PATH_MAX];
    Path(buf, path, "");
    for (char* p = buf + 1; *p; ++p) {
        if (*p != '/')
            continue;
        *p = '\0';
        MakeDir(buf, 0755);
        *p = '/';
    }
    MakeDir(buf, 0755);
}

/* The per-mount flags a bind remount would otherwise clear (nosuid, nodev, ...). */
static unsigned long KeptMountFlags(const char* path) {
    static const struct {
        unsigned long st, ms;
    } kFlags[] = {{ST_NOSUID, MS_NOSUID},         {ST_NODEV, MS_NODEV},
                  {ST_NOEXEC, MS_NOEXEC},         {ST_NOATIME, MS_NOATIME},
                  {ST_NODIRATIME, MS_NODIRATIME}, {ST_RELATIME, MS_RELATIME}};
    struct statvfs vfs;
    unsigned long flags = 0;
    if (statvfs(path, &vfs) != 0)
        return 0;
    for (size_t i = 0; i < sizeof kFlags / sizeof kFlags[0]; ++i) {
        if (vfs.f_flag & kFlags[i].st)
            flags |= kFlags[i].ms;
    }
    return flags;
}

/* Decodes the octal escapes (\040 for a blank, ...) of a mount point in mountinfo. */
static void DecodeMountPoint(char* s) {
    char* out = s;
    for (char* in = s; *in; ++out) {
        if (in[0] == '\\' && in[1] >= '0' && in[1] <= '3' && in[2] >= '0' && in[2] <= '7' &&
            in[3] >= '0' && in[3] <= '7') {
            *out = (char)((in[1] - '0') * 64 + (in[2] - '0') * 8 + (in[3] - '0'));
            in += 4;
        } else {
            *out = *in++;
        }
    }
    *out = '\0';
}

/* Remounts read-only the mount at path and every mount below it, one by one: the way
 * for kernels without mount_setattr. */
static void RemountTreeReadOnly(const char* path) {
    size_t n = strlen(path);
    FILE* f = fopen("/proc/self/mountinfo", "re");
    if (f == NULL)
        Fail(NULL, "read /proc/self/mountinfo");
    char line[3 * PATH_MAX];
    while (fgets(line, sizeof line, f) != NULL) {
        /* "id parent major:minor root mountpoint options ..." */
        char* field = line;
        for (int i = 0; i < 4 && field != NULL; ++i) {
            field = strchr(field, ' ');
            if (field != NULL)
                ++field;
        }
        if (field == NULL)
            continue;
        char* end = strchr(field, ' ');
        if (end == NULL)
            continue;
        *end = '\0';
        DecodeMountPoint(field);
        if (strncmp(field, path, n) != 0 || (field[n] != '\0' && field[n] != '/'))
            continue;
        unsigned long kept = KeptMountFlags(field);
        if (mount(NULL, field, NULL, MS_REMOUNT | MS_BIND | MS_RDONLY | kept, NULL) != 0) {
            fclose(f);
            Fail(NULL, "remount %s read-only", field);
        }
    }
    fclose(f);
}

/* Makes a mount read-only together with everything mounted below it: in one step where
 * the kernel has mount_setattr, else mount by mount. */
static void MakeReadOnly(const char* path) {
#ifdef SYS_mount_setattr
    struct {
        uint64_t attr_set, attr_clr, propagation, userns_fd;
    } attr = {0x1 /* MOUNT_ATTR_RDONLY */, 0, 0, 0};
    if (syscall(SYS_mount_setattr, AT_FDCWD, path, 0x8000 /* AT_RECURSIVE */, &attr, sizeof attr) ==
        0)
        return;
#endif
    RemountTreeReadOnly(path);
}

static void BindReadOnly(const char* src, const char* dst) {
    Mount(src, dst, NULL, MS_BIND | MS_REC, NULL, NULL);
    MakeReadOnly(dst);
}

static void CreateFile(const char* path, mode_t mode) {
    int fd = open(path, O_WRONLY | O_CREAT | O_CLOEXEC, mode);
    if (fd < 0)
        Fail(NULL, "create %s", path);
    close(fd);
}

static void Symlink(const char* target, const char* path) {
    if (symlink(target, path) != 0)
        Fail(NULL, "create symbolic link %s", path);
}

/* Real path of the program as exec would find it (PATH search for a bare name). */
static int ResolveProgram(const char* prog, char* out) {
    if (strchr(prog, '/') != NULL)
        return realpath(prog, out) != NULL;
    const char* path = getenv("PATH");
    if (path == NULL)
        path = "/usr/local/bin:/usr/bin:/bin";
    while (*path) {
        const char* end = strchrnul(path, ':');
        char cand[PATH_MAX];
        int n = snprintf(cand, sizeof cand, "%.*s/%s", (int)(end - path), path, prog);
        if (n > 0 && n < (int)sizeof cand && access(cand, X_OK) == 0 && realpath(cand, out) != NULL)
            return 1;
        path = *end ? end + 1 : end;
    }
    return 0;
}

/* True when path lies in a folder the sandbox replaces with a fresh file system. */
static int InReplacedFolder(const char* path) {
    static const char* const kReplaced[] = {"/tmp/", "/run/", "/dev/", "/proc/", "/sys/"};
    for (size_t i = 0; i < sizeof kReplaced / sizeof kReplaced[0]; ++i) {
        if (strncmp(path, kReplaced[i], strlen(kReplaced[i])) == 0)
            return 1;
    }
    return 0;
}

/*
 * Makes a file (program or script) visible at the same path in the new root, together with
 * what lies beside it (a build tree's shared libraries).  The overlay's lower layer is only
 * the root file system, not what is mounted below it: when the file lives on another file
 * system, the whole mount that holds it is bound read-only.  When it lives in a folder the
 * sandbox replaces (/tmp, /run), the top folder holding it there (/tmp/<name>) is bound
 * read-only.  `bound` keeps the last folder bound, so a second file in it binds nothing.
 */
static void BindFileFolder(const char* file, const char* root, char* bound) {
    struct stat rootSt, st;
    char dir[PATH_MAX];
    if (stat("/", &rootSt) != 0)
        Fail(NULL, "stat /");
    Path(dir, file, "");
    if (InReplacedFolder(file)) {
        char* second = strchr(dir + 1, '/');
        char* third = strchr(second + 1, '/');
        if (third != NULL)
            *third = '\0';
    } else {
        char* slash = strrchr(dir, '/');
        *(slash == dir ? slash + 1 : slash) = '\0';
        if (stat(dir, &st) != 0)
            Fail(NULL, "stat %s", dir);
        if (st.st_dev == rootSt.st_dev)
            return;
        /* Walk up to the top folder of that file system: its mount point. */
        for (;;) {
            char parent[PATH_MAX];
            struct stat pst;
            Path(parent, dir, "");
            slash = strrchr(parent, '/');
            *(slash == parent ? slash + 1 : slash) = '\0';
            if (strcmp(parent, dir) == 0 || stat(parent, &pst) != 0 || pst.st_dev != st.st_dev)
                break;
            Path(dir, parent, "");
        }
    }
    size_t n = strlen(bound);
    if (n > 0 && strncmp(dir, bound, n) == 0 && (dir[n] == '\0' || dir[n] == '/'))
        return;
    if (stat(dir, &st) != 0)
        Fail(NULL, "stat %s", dir);
    char dst[PATH_MAX];
    Path(dst, root, dir);
    if (S_ISDIR(st.st_mode)) {
        MakeDirs(dst);
    } else {
        char* slash = strrchr(dst, '/');
        *slash = '\0';
        MakeDirs(dst);
        *slash = '/';
        CreateFile(dst, 0644);
    }
    BindReadOnly(dir, dst);
    Path(bound, dir, "");
}

/* A scratch folder for the tmpfs that holds the overlay's upper layer: an existing folder
 * on the host that is not above the program or the script (the mount hides its content,
 * in this namespace only). */
static const char* PickScratch(const char* prog, const char* script) {
    static const char* const kCandidates[] = {"/mnt", "/media", "/srv", "/opt", "/tmp"};
    for (size_t i = 0; i < sizeof kCandidates / sizeof kCandidates[0]; ++i) {
        const char* c = kCandidates[i];
        size_t n = strlen(c);
        struct stat st;
        if (lstat(c, &st) != 0 || !S_ISDIR(st.st_mode))
            continue;
        if ((strncmp(prog, c, n) == 0 && prog[n] == '/') ||
            (strncmp(script, c, n) == 0 && script[n] == '/'))
            continue;
        return c;
    }
    errno = ENOENT;
    Fail("needs one of /mnt, /media, /srv, /opt or /tmp as an existing folder",
         "find a folder for the scratch file system");
}

static void SetUpDev(const char* root) {
    static const char* const kNodes[] = {"null", "zero", "full", "random", "urandom", "tty"};
    char dev[PATH_MAX], p[PATH_MAX], src[PATH_MAX];
    Path(dev, root, "/dev");
    MakeDirs(dev);
    Mount("tmpfs", dev, "tmpfs", MS_NOSUID | MS_NOEXEC, "mode=0755,size=1m", NULL);
    for (size_t i = 0; i < sizeof kNodes / sizeof kNodes[0]; ++i) {
        Path(src, "/dev/", kNodes[i]);
        Path(p, dev, src + 4);
        CreateFile(p, 0666);
        Mount(src, p, NULL, MS_BIND, NULL, "needs the host's /dev/null, /dev/zero, ...");
    }
    Path(p, dev, "/pts");
    MakeDir(p, 0755);
    if (mount("devpts", p, "devpts", MS_NOSUID | MS_NOEXEC, "newinstance,ptmxmode=0666,mode=620") !=
        0)
        Mount("/dev/pts", p, NULL, MS_BIND, NULL, NULL);
    Path(p, dev, "/ptmx");
    Symlink("pts/ptmx", p);
    Path(p, dev, "/shm");
    MakeDir(p, 01777);
    Mount("tmpfs", p, "tmpfs", MS_NOSUID | MS_NODEV, "mode=1777", NULL);
    Path(p, dev, "/fd");
    Symlink("/proc/self/fd", p);
    Path(p, dev, "/stdin");
    Symlink("/proc/self/fd/0", p);
    Path(p, dev, "/stdout");
    Symlink("/proc/self/fd/1", p);
    Path(p, dev, "/stderr");
    Symlink("/proc/self/fd/2", p);
}

static void BuildRoot(const char* root_parent, const char* prog_real, const char* script_real) {
    char upper[PATH_MAX], work[PATH_MAX], root[PATH_MAX], p[PATH_MAX], opts[3 * PATH_MAX + 64];
    Mount("kyto-sandbox", root_parent, "tmpfs", 0, "mode=0755", kNeeds);
    Path(upper, root_parent, "/upper");
    Path(work, root_parent, "/work");
    Path(root, root_parent, "/root");
    MakeDir(upper, 0755);
    MakeDir(work, 0755);
    MakeDir(root, 0755);
    snprintf(opts, sizeof opts, "lowerdir=/,upperdir=%s,workdir=%s", upper, work);
    Mount("overlay", root, "overlay", 0, opts,
          "needs a kernel with overlayfs (modprobe overlay) and root (CAP_SYS_ADMIN)");

    Path(p, root, "/proc");
    MakeDirs(p);
    Mount("proc", p, "proc", MS_NOSUID | MS_NODEV | MS_NOEXEC, NULL, kNeeds);
    /* A test can read kernel settings but never change the host's (most are not
     * namespaced) nor reboot the host through sysrq (absent from kernels built without
     * it). */
    Path(p, root, "/proc/sys");
    BindReadOnly(p, p);
    Path(p, root, "/proc/sysrq-trigger");
    if (access(p, F_OK) == 0)
        BindReadOnly(p, p);
    Path(p, root, "/sys");
    MakeDirs(p);
    BindReadOnly("/sys", p);
    SetUpDev(root);
    Path(p, root, "/run");
    MakeDirs(p);
    Mount("tmpfs", p, "tmpfs", MS_NOSUID | MS_NODEV, "mode=0755", NULL);
    Path(p, root, "/tmp");
    MakeDirs(p);
    Mount("tmpfs", p, "tmpfs", MS_NOSUID | MS_NODEV, "mode=1777", NULL);
    char bound[PATH_MAX] = "";
    BindFileFolder(prog_real, root, bound);
    BindFileFolder(script_real, root, bound);

    Path(p, root, "/.kyto-sandbox");
    CreateFile(p, 0644);

    if (chroot(root) != 0)
        Fail(kNeeds, "chroot into %s", root);
    if (chdir("/") != 0)
        Fail(NULL, "change to /");
}

/* Writes one datagram as one line; backslash and newline escaped, trailing NULs and
 * newlines dropped. */
static void CatchOne(int logFd, const char* msg, size_t n, char* line) {
    while (n > 0 && (msg[n - 1] == '\0' || msg[n - 1] == '\n'))
        --n;
    size_t out = 0;
    for (size_t i = 0; i < n; ++i) {
        if (msg[i] == '\\' || msg[i] == '\n') {
            line[out++] = '\\';
            line[out++] = msg[i] == '\n' ? 'n' : '\\';
        } else {
            line[out++] = msg[i];
        }
    }
    line[out++] = '\n';
    for (size_t done = 0; done < out;) {
        ssize_t w = write(logFd, line + done, out - done);
        if (w < 0 && errno == EINTR)
            continue;
        if (w <= 0)
            return;
        done += (size_t)w;
    }
}

static void StartSyslogCatcher(void) {
    int sock = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (sock < 0)
        Fail(NULL, "create the syslog socket");
    struct sockaddr_un addr;
    memset(&addr, 0, sizeof addr);
    addr.sun_family = AF_UNIX;
    strcpy(addr.sun_path, "/dev/log");
    if (bind(sock, (struct sockaddr*)&addr, sizeof addr) != 0)
        Fail(NULL, "bind /dev/log");
    if (chmod("/dev/log", 0666) != 0)
        Fail(NULL, "chmod /dev/log");
    MakeDirs("/var/log");
    int logFd = open("/var/log/sandbox.syslog", O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
    if (logFd < 0)
        Fail(NULL, "create /var/log/sandbox.syslog");

    pid_t pid = fork();
    if (pid < 0)
        Fail(NULL, "start the syslog catcher");
    if (pid == 0) {
        enum { kMax = 256 * 1024 };
        static char msg[kMax], line[2 * kMax + 2];
        signal(SIGTERM, SIG_DFL);
        signal(SIGINT, SIG_DFL);
        for (;;) {
            ssize_t n = recv(sock, msg, sizeof msg, 0);
            if (n < 0) {
                if (errno == EINTR)
                    continue;
                _exit(1);
            }
            CatchOne(logFd, msg, (size_t)n, line);
        }
    }
    close(sock);
    close(logFd);
}

/* A new network namespace starts with its loopback interface down; the kernel gives it
 * 127.0.0.1 when it goes up. */
static void BringUpLoopback(void) {
    int sock = socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
    if (sock < 0)
        Fail(NULL, "create a socket to configure the loopback interface");
    struct ifreq ifr;
    memset(&ifr, 0, sizeof ifr);
    strcpy(ifr.ifr_name, "lo");
    if (ioctl(sock, SIOCGIFFLAGS, &ifr) != 0)
        Fail(NULL, "read the flags of the loopback interface");
    ifr.ifr_flags |= IFF_UP;
    if (ioctl(sock, SIOCSIFFLAGS, &ifr) != 0)
        Fail(NULL, "bring the loopback interface up");
    close(sock);
}

static void Provision(void) {
    pid_t pid = fork();
    if (pid < 0)
        Fail(NULL, "start the provisioning script");
    if (pid == 0) {
        execl("/bin/sh", "sh", KYTO_PROVISION_SCRIPT, (char*)NULL);
        fprintf(stderr, "kyto-sandbox: cannot run /bin/sh %s: %s\n", KYTO_PROVISION_SCRIPT,
                strerror(errno));
        _exit(EXEC_FAILED);
    }
    int rc = WaitFor(pid);
    if (rc != 0) {
        fprintf(stderr, "kyto-sandbox: cannot provision the sandbox: %s exited with %d\n",
                KYTO_PROVISION_SCRIPT, rc);
        _exit(SETUP_FAILED);
    }
}

/* The sandbox's init (pid 1 of the new pid namespace). */
static void SandboxInit(char** argv, const char* prog_real, const char* script_real) {
    BuildRoot(PickScratch(prog_real, script_real), prog_real, script_real);
    StartSyslogCatcher();
    Provision();

    pid_t pid = fork();
    if (pid < 0)
        Fail(NULL, "start %s", argv[0]);
    if (pid == 0) {
        signal(SIGTERM, SIG_DFL);
        signal(SIGINT, SIG_DFL);
        signal(SIGHUP, SIG_DFL);
        /* The resolved path: a relative one would now resolve against the new root. */
        execv(prog_real, argv);
        fprintf(stderr, "kyto-sandbox: cannot run %s: %s\n", argv[0], strerror(errno));
        _exit(EXEC_FAILED);
    }
    g_forward_pid = pid;
    _exit(WaitFor(pid));
}

int main(int argc, char** argv) {
    if (argc < 2) {
        fprintf(stderr, "usage: kyto-sandbox PROGRAM [ARGS...]\n");
        return 2;
    }
    if (geteuid() != 0) {
        errno = EPERM;
        Fail(kNeeds, "set up the sandbox as user %d", (int)geteuid());
    }
    char prog_real[PATH_MAX], script_real[PATH_MAX];
    if (!ResolveProgram(argv[1], prog_real))
        Fail(NULL, "find program %s", argv[1]);
    if (realpath(KYTO_PROVISION_SCRIPT, script_real) == NULL)
        Fail(NULL, "find the provisioning script %s", KYTO_PROVISION_SCRIPT);

    if (unshare(CLONE_NEWNS | CLONE_NEWPID | CLONE_NEWNET) != 0)
        Fail(kNeeds, "create mount, pid and network namespaces");
    BringUpLoopback();
    if (mount(NULL, "/", NULL, MS_REC | MS_PRIVATE, NULL) != 0)
        Fail(kNeeds, "make the mounts private");

    InstallForwarding();
    pid_t init = fork();
    if (init < 0)
        Fail(NULL, "start the sandbox");
    if (init == 0) {
        /* When the launcher dies (a test runner's timeout kill), the sandbox goes too. */
        prctl(PR_SET_PDEATHSIG, SIGKILL);
        SandboxInit(argv + 1, prog_real, script_real);
    }
    g_forward_pid = init;
    int rc = WaitFor(init);
    fflush(NULL);
    return rc;
}
