/* What the runners in C and C++ share: the words of a line. */
#ifndef RUNNER_H
#define RUNNER_H

#include <stdio.h>
#include <stdlib.h>
#include <string.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <tessel/trace.h>
#include <unistd.h>

static char line[1 << 20];
static char* rest;

static const char* next_word(void) { return strtok_r(NULL, " \n", &rest); }

/* A text is written in hexadecimal behind an x; "-" is null. Decoded where it stands. */
static const char* next_text(void) {
  char* const word = (char*)next_word();
  if (*word == '-') return NULL;
  char* out = word;
  for (const char* in = word + 1; *in; in += 2) {
    const char digits[3] = {in[0], in[1], 0};
    *out++ = (char)strtoul(digits, NULL, 16);
  }
  *out = 0;
  return word;
}

/* Points that are larger than this fit no datagram. */
static void shrink_sockets(int size) {
  for (int fd = 3; fd < 64; ++fd) setsockopt(fd, SOL_SOCKET, SO_SNDBUF, &size, sizeof size);
}

/* The child goes on with the lines, the parent waits for its end. Answers whether this is it. */
static int go_on_in_child(void) {
  fflush(stdout);
  const pid_t child = fork();
  if (child != 0) waitpid(child, NULL, 0);
  return child == 0;
}

/* The actions that concern the process and no trace point. */
static int act_on_process(const char* word) {
  if (*word == 'z') {
    shrink_sockets(4096);
  } else if (*word == 'o') {
    tessel_enable(next_word()[0] == '1');
  } else {
    return -1;
  }
  return 0;
}

/* Answers each line with what `run_line` answers, until there is none, or it answers -2. */
static void run_lines(int (*run_line)(void)) {
  while (fgets(line, sizeof line, stdin)) {
    const int answer = run_line();
    if (answer == -2) return;
    printf("%d\n", answer);
    fflush(stdout);
  }
}

#endif
