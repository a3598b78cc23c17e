// What a process inherits from whoever starts it, brought into one known state: streams,
// descriptors, environment, signals, umask, working directory.
//
// Threads: one, before there are others.
#pragma once

namespace orv::server {

// Opens /dev/null for those of the three standard streams that are closed: a file of the server's
// must never become what libraries take for standard error. Standard input is /dev/null in any
// case; nobody is asked anything.
void settle_standard_streams() noexcept;

// Closes what was inherited beyond the standard streams and the `kept` descriptors that follow
// them (those that a service manager hands over).
void close_inherited_descriptors(int kept) noexcept;

// Takes every variable away that the server or its libraries have no use for, and overwrites what
// it said: environments hold secrets of those who start programs. Kept are locale and time zone,
// the settings of OpenSSL and Kerberos (which TMPDIR is one of), and what tools for testing look
// for.
void clean_environment() noexcept;

// No file that is made is anybody else's, no folder is held, no signal is ignored or blocked that
// somebody else wanted so. SIGPIPE is ignored. SIGHUP waits until accept_hangup(), lest one that
// comes too early ends the server; threads that are made before do not take it.
void settle_process() noexcept;
void accept_hangup() noexcept;

}  // namespace orv::server
