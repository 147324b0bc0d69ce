/*
 * Runs a command and writes its peak resident set size in KiB to a file,
 * like `/usr/bin/time -o FILE -f %M`.  Used only when that program is
 * missing: a Python parent cannot measure this itself, because a child it
 * forks starts from the Python process's own resident pages and the kernel
 * keeps that figure as the child's peak across exec.
 *
 *   peak_rss OUTFILE COMMAND [ARG...]
 *
 * Exits with the command's status, or 128 + signal number.
 */
#define _GNU_SOURCE
#include <stdio.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

int main(int argc, char **argv)
{
    if (argc < 3) {
        fprintf(stderr, "usage: %s OUTFILE COMMAND [ARG...]\n", argv[0]);
        return 2;
    }
    pid_t pid = fork();
    if (pid < 0) {
        perror("fork");
        return 127;
    }
    if (pid == 0) {
        execvp(argv[2], argv + 2);
        perror(argv[2]);
        _exit(127);
    }
    int status = 0;
    struct rusage usage;
    if (wait4(pid, &status, 0, &usage) < 0) {
        perror("wait4");
        return 127;
    }
    FILE *out = fopen(argv[1], "w");
    if (out) {
        fprintf(out, "%ld\n", usage.ru_maxrss);
        fclose(out);
    }
    if (WIFSIGNALED(status))
        return 128 + WTERMSIG(status);
    return WEXITSTATUS(status);
}
