#pragma once

#include <cerrno>
#include <cstddef>
#include <functional>
#include <linux/filter.h>
#include <linux/seccomp.h>
#include <stdexcept>
#include <sys/prctl.h>
#include <sys/syscall.h>
#include <thread>

namespace rolvane::test {

// Calls it on a thread that gets no watch of directories from the kernel, nor do the programs that are started there:
// as if the user's other processes had taken every one (EMFILE). An exception ends the test program.
inline void withoutInotify(const std::function<void()>& body) {
    std::thread([&] {
        sock_filter lines[] = {
            BPF_STMT(BPF_LD | BPF_W | BPF_ABS, offsetof(seccomp_data, nr)),
            BPF_JUMP(BPF_JMP | BPF_JEQ | BPF_K, __NR_inotify_init1, 0, 1),
            BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ERRNO | EMFILE),
            BPF_STMT(BPF_RET | BPF_K, SECCOMP_RET_ALLOW),
        };
        const sock_fprog program{sizeof lines / sizeof *lines, lines};
        if (prctl(PR_SET_NO_NEW_PRIVS, 1, 0, 0, 0) != 0 || prctl(PR_SET_SECCOMP, SECCOMP_MODE_FILTER, &program) != 0)
            throw std::runtime_error("the kernel takes no filter of system calls");
        body();
    }).join();
}

} // namespace rolvane::test
