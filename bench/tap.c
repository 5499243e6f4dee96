/*
 * Preloaded into the updater, and into none of its children: writes the start and the end of every command and every
 * wait to the file named by BENCH_CALLS, one line each, columns separated by tabs:
 *
 *   seconds of CLOCK_MONOTONIC, thread id, "system" | "popen" | "nanosleep", "start" | "end", value, text
 *
 * The value is the raw status at the end of a command, the seconds asked for at the start of a wait, otherwise 0. The
 * text is the command line, at both its start and its end. Time comes from the kernel itself: a preloaded clock does not
 * change it.
 */
#define _GNU_SOURCE
#include <dlfcn.h>
#include <errno.h>
#include <fcntl.h>
#include <pthread.h>
#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/syscall.h>
#include <time.h>
#include <unistd.h>

#define NEXT(name) ((__typeof__(&name))dlsym(RTLD_NEXT, #name))

/* The updater reads one command at a time on a thread. */
static __thread char pipe_command[4096];

static void write_line(const char *call, const char *phase, long value, const char *text)
{
	char line[8192];
	struct timespec now;
	const char *path = getenv("BENCH_CALLS");
	int saved = errno;

	if (path == NULL)
		return;
	syscall(SYS_clock_gettime, CLOCK_MONOTONIC, &now);
	int length = snprintf(line, sizeof line, "%lld.%06ld\t%ld\t%s\t%s\t%ld\t%s\n", (long long)now.tv_sec,
			      now.tv_nsec / 1000, (long)syscall(SYS_gettid), call, phase, value, text);
	int file = open(path, O_WRONLY | O_APPEND | O_CREAT | O_CLOEXEC, 0644);
	if (file >= 0 && length > 0 && (size_t)length < sizeof line) {
		ssize_t written = write(file, line, (size_t)length);
		(void)written;
	}
	if (file >= 0)
		close(file);
	errno = saved;
}

int system(const char *command)
{
	write_line("system", "start", 0, command);
	int status = NEXT(system)(command);
	write_line("system", "end", status, command);
	return status;
}

FILE *popen(const char *command, const char *type)
{
	write_line("popen", "start", 0, command);
	FILE *stream = NEXT(popen)(command, type);
	snprintf(pipe_command, sizeof pipe_command, "%s", command);
	if (stream == NULL)
		write_line("popen", "end", -1, command);
	return stream;
}

int pclose(FILE *stream)
{
	int status = NEXT(pclose)(stream);
	write_line("popen", "end", status, pipe_command);
	return status;
}

int nanosleep(const struct timespec *asked, struct timespec *remaining)
{
	write_line("nanosleep", "start", (long)asked->tv_sec, "");
	int result = NEXT(nanosleep)(asked, remaining);
	write_line("nanosleep", "end", 0, "");
	return result;
}
