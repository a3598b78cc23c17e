"""Checks the dependency arrows: which headers each folder includes, and what each binary links.

    orvd, orvcfg  ->  slapi  ->  cfg        back-config  ->  slapi, cfg
    orvd  ->  back-config  through dlopen only

Also that nothing of ours changes the process's locale: rules compare with strcasecmp, and under a
Turkish locale "ConfigDB" and "CONFIGDB" would be two names.
"""

import os
import re
import subprocess

import findings

# Headers of POSIX, the C library and the compiler that every folder may include.
POSIX = set("""
arpa/inet.h dirent.h dlfcn.h errno.h fcntl.h fnmatch.h grp.h iconv.h ifaddrs.h langinfo.h limits.h
locale.h malloc.h net/if.h netdb.h netinet/in.h netinet/tcp.h nl_types.h poll.h pthread.h pwd.h sched.h
semaphore.h signal.h stdint.h stdlib.h string.h strings.h sys/epoll.h sys/eventfd.h sys/file.h
sys/ioctl.h sys/mman.h sys/prctl.h sys/random.h sys/resource.h sys/select.h sys/socket.h sys/stat.h
sys/statvfs.h sys/syscall.h sys/time.h sys/types.h sys/uio.h sys/un.h sys/utsname.h sys/wait.h
sys/xattr.h syslog.h termios.h time.h unistd.h wchar.h linux/capability.h linux/fs.h emmintrin.h
""".split())

# folder: folders whose public headers it may include, and third-party headers (by prefix).
INCLUDES = {
    "cfg": (["cfg"], ["crypt.h", "openssl/", "ldap.h", "lber.h", "utf8proc.h", "unicode/"]),
    "slapi": (["slapi", "cfg", "schema"],
              ["openssl/", "ldap.h", "ldap_schema.h", "lber.h", "spdlog/"]),
    "back-config": (["slapi", "cfg"], []),
    "orvd": (["slapi", "cfg", "schema", "config"],
             ["asio.hpp", "asio/", "sasl/", "gssapi/", "openssl/", "ldap.h", "lber.h", "spdlog/", "CLI/",
              "utf8proc.h", "seccomp.h"]),
    "orvcfg": (["slapi", "cfg", "config"], ["CLI/", "openssl/"]),
    "schema": (["schema"], []),
    "config": (["config"], []),
}

RUNTIME = r"lib(stdc\+\+|m|c|gcc_s|pthread|dl|asan|ubsan|tsan|lsan|gcov)\.so.*|ld-linux.*"
LDAP = r"lib(ldap|lber)(-2\.\d+)?\.so.*"
OPENSSL = r"lib(ssl|crypto)\.so.*"
CRYPT = r"libcrypt\.so.*"

# binary: what it may link besides the run-time libraries of the compiler, and what it must link.
LINKS = {
    "lib/libcfg.so": ([CRYPT, LDAP, OPENSSL, r"libutf8proc\.so.*", r"libicu.*"], []),
    "lib/libslapi.so": ([r"libcfg\.so", LDAP, OPENSSL, r"lib(spdlog|fmt)\.so.*"], ["libcfg.so"]),
    "lib/libback-config.so": ([r"libslapi\.so", r"libcfg\.so"], ["libslapi.so"]),
    "bin/orvd": ([r"libslapi\.so", r"libcfg\.so", LDAP, OPENSSL, r"lib(spdlog|fmt)\.so.*",
                  r"libsasl2\.so.*", r"libgssapi_krb5\.so.*", r"libseccomp\.so.*"],
                 ["libslapi.so"]),
    "bin/orvcfg": ([r"libslapi\.so", r"libcfg\.so", OPENSSL], ["libcfg.so"]),
}

FORBIDDEN_CALLS = {"setlocale", "uselocale"}

INCLUDE = re.compile(r'^\s*#\s*include\s*([<"])([^>"]+)[>"]', re.MULTILINE)


def is_standard(header):
    return "/" not in header and not header.endswith((".h", ".hpp"))


def is_own(source, folder, path, header):
    places = [os.path.dirname(path), folder, os.path.join(folder, "src")]
    return any(os.path.isfile(os.path.join(source, place, header)) for place in places)


def header_is_allowed(source, folder, path, quoted, header):
    public, third_party = INCLUDES[folder]
    if quoted and is_own(source, folder, path, header):
        return True
    owner = header.split("/")[0]
    is_public = os.path.isfile(os.path.join(source, owner, "include", header))
    if is_public:
        return owner in public
    if quoted:
        return False
    return (is_standard(header) or header in POSIX or
            any(header.startswith(prefix) for prefix in third_party))


def include_findings(source):
    found = []
    for folder in INCLUDES:
        for name in findings.files(os.path.join(source, folder), (".h", ".cpp")):
            path = os.path.join(folder, name)
            for bracket, header in INCLUDE.findall(findings.read(source, path)):
                if not header_is_allowed(source, folder, path, bracket == '"', header):
                    found.append(f"{path}: may not include {header}")
    return found


def needed_libraries(binary):
    text = subprocess.run(["readelf", "-d", "-W", binary], check=True, capture_output=True,
                          text=True).stdout
    return re.findall(r"\(NEEDED\).*\[(.*)\]", text)


def imported_functions(binary):
    text = subprocess.run(["nm", "-D", "-P", "--undefined-only", binary], check=True,
                          capture_output=True, text=True).stdout
    return {line.split()[0].split("@")[0] for line in text.splitlines() if line}


def link_findings(build):
    found = []
    for binary, (allowed, required) in LINKS.items():
        path = os.path.join(build, binary)
        if not os.path.exists(path):
            found.append(f"{binary}: was not built")
            continue
        found += [f"{binary}: calls {name}"
                  for name in sorted(imported_functions(path) & FORBIDDEN_CALLS)]
        needed = needed_libraries(path)
        for library in needed:
            if not any(re.fullmatch(pattern, library) for pattern in [RUNTIME, *allowed]):
                found.append(f"{binary}: may not link {library}")
        for library in required:
            if library not in needed:
                found.append(f"{binary}: does not link {library}")
    return found


def main():
    options = findings.arguments(__doc__)
    found = include_findings(options.source)
    if options.build:
        found += link_findings(options.build)
    findings.conclude(found, "dependency arrows")


if __name__ == "__main__":
    main()
