"""Measures how much of the sources the tests reach, and fails where it is less than it must be.

usage: measure.py [--build DIR] [--jobs N] [--no-build] [--no-run] [--uncovered]

Builds with the counters of the compiler in a folder of its own (build/coverage, or DIR), runs the test
programs, and prints lines and branches for each file:

    back-config/  by backend_unit_tests, on the scripted platform:  every line, every branch
    cfg/          by cfg_test and cfg_allocation_test:              95 % of the branches

Branches that the compiler makes for exceptions are left out: nearly every call has one, and they lead
to the release of what was held. So are those of lines that hold nothing but brackets: they are parts of
the same release. Headers count for the folder that they lie in, as they are compiled there. Of a
template, a branch counts as taken when one of its uses took it.

unreachable.txt, beside this file, names the lines that no test can reach, each with its reason. They
are left out of the figures of back-config/, and of cfg/ they count as not reached. An entry that fits
no line any more, or whose line is reached after all, is a failure.

Needs nothing that the tests do not need: gcov comes with the compiler. Building takes some minutes;
therefore neither ./test nor .ci/run does this.
"""
import argparse
import collections
import functools
import itertools
import json
import os
import pathlib
import subprocess
import sys

ROOT = pathlib.Path(__file__).resolve().parents[2]
LIST = pathlib.Path(__file__).with_name("unreachable.txt")

# Of a folder, which has the same name in the build tree: the programs that are to reach it, how much
# they must reach, in per cent, and whether listed lines are left out of that.
Folder = collections.namedtuple("Folder", "name programs least_lines least_branches excuses")
FOLDERS = (
    Folder("back-config", ("backend_unit_tests",), 100.0, 100.0, True),
    Folder("cfg", ("cfg_test", "cfg_allocation_test"), 0.0, 95.0, False),
)
PROGRAMS = [program for folder in FOLDERS for program in folder.programs]


class Line:
    """Counts of one source line: how often it ran, and how often each of its branches was taken."""

    def __init__(self):
        self.count = 0
        self.branches = []

    def add_use(self, count, branches):
        """The same code once more: another use of a template, or of a header."""
        self.count += count
        pairs = itertools.zip_longest(self.branches, branches, fillvalue=0)
        self.branches = [before + more for before, more in pairs]

    def add_function(self, other):
        """Code of another function on the same line: that of a lambda."""
        self.count += other.count
        self.branches += other.branches


# ---- Building and running


def build(folder, jobs):
    subprocess.run(["cmake", "--preset", "coverage", "-S", ROOT, "-B", folder], check=True, cwd=ROOT,
                   stdout=subprocess.DEVNULL)
    subprocess.run(["ninja", "-C", folder, f"-j{jobs}", *PROGRAMS], check=True)


def run_tests(folder):
    for counters in folder.rglob("*.gcda"):
        counters.unlink()
    for program in PROGRAMS:
        log = folder / f"{program}.log"
        with open(log, "wb") as output:
            code = subprocess.run([folder / "bin" / program], cwd=folder, stdin=subprocess.DEVNULL,
                                  stdout=output, stderr=subprocess.STDOUT).returncode
        if code != 0:
            sys.exit(f"{program} ended with {code}: see {log}")


# ---- Reading


def gcov_reports(objects):
    """What gcov says about each object file of a folder, in its JSON form."""
    notes = sorted(str(path) for path in objects.rglob("*.gcno"))
    if not notes:
        sys.exit(f"nothing was built in {objects}")
    text = subprocess.run(["gcov", "--json-format", "--stdout", "--branch-probabilities", *notes],
                          check=True, capture_output=True, text=True, cwd=objects).stdout
    return [json.loads(report) for report in text.splitlines() if report.strip()]


def taken(branches):
    return [branch["count"] for branch in branches if not branch["throw"]]


def without_code(text):
    """Whether a line of source holds only brackets."""
    return text.strip() != "" and not text.strip(" \t{}();")


@functools.cache
def bare_lines(path):
    """Numbers of the lines of a source that hold only brackets."""
    source = (ROOT / path).read_text(encoding="utf-8").splitlines()
    return {number for number, text in enumerate(source, 1) if without_code(text)}


def lines_of(folder, build_folder):
    """Line by (path, number), for the sources of a folder."""
    functions = collections.defaultdict(Line)  # by place of the line and place of its function
    for report in gcov_reports(build_folder / folder.name):
        top = report["current_working_directory"]
        for file in report["files"]:
            path = os.path.relpath(os.path.join(top, file["file"]), ROOT)
            if not path.startswith(folder.name + "/"):
                continue
            starts = {f["name"]: (f["start_line"], f["start_column"]) for f in file["functions"]}
            for line in file["lines"]:
                start = starts.get(line.get("function_name"), (0, 0))
                number = line["line_number"]
                branches = [] if number in bare_lines(path) else taken(line["branches"])
                functions[path, number, start].add_use(line["count"], branches)
    lines = collections.defaultdict(Line)
    for (path, number, _), function in sorted(functions.items()):
        lines[path, number].add_function(function)
    return lines


# ---- The list of what cannot be reached


def excuses(text):
    """(path, text of the line) with the reason and the place in the list."""
    found, path = {}, None
    for number, entry in enumerate(text.splitlines(), 1):
        if entry.startswith("== "):
            path = entry[3:].strip()
        elif entry.strip() and not entry.startswith("#"):
            line, _, reason = entry.partition(" -> ")
            if not path or not reason.strip():
                sys.exit(f"{LIST.name}:{number}: not \"text of a line -> reason\" below a file")
            found[path, line.strip()] = (reason.strip(), number)
    return found


def excused_lines(listed, lines, root=ROOT):
    """The listed lines by (path, number), and what is wrong with the list."""
    excused, wrong = {}, []
    for (path, text), (reason, number) in listed.items():
        source = pathlib.Path(root, path).read_text(encoding="utf-8").splitlines()
        places = [i for i, line in enumerate(source, 1) if text in line]
        if len(places) != 1:
            wrong.append(f"{LIST.name}:{number}: stands {len(places)} times in {path}: {text}")
        elif (path, places[0]) not in lines:
            wrong.append(f"{LIST.name}:{number}: is no code in {path}: {text}")
        elif complete(lines[path, places[0]]):
            wrong.append(f"{LIST.name}:{number}: is reached: {path}:{places[0]}: {text}")
        else:
            excused[path, places[0]] = reason
    return excused, wrong


# ---- Figures


def complete(line):
    return line.count > 0 and all(line.branches)


def per_cent(part, whole):
    return 100.0 * part / whole if whole else 100.0


class Figures:
    def __init__(self):
        self.lines = self.lines_reached = self.branches = self.branches_taken = 0

    def add(self, line):
        self.lines += 1
        self.lines_reached += line.count > 0
        self.branches += len(line.branches)
        self.branches_taken += sum(count > 0 for count in line.branches)

    def shares(self):
        return per_cent(self.lines_reached, self.lines), per_cent(self.branches_taken, self.branches)

    def text(self):
        lines, branches = self.shares()
        return (f"{self.lines_reached:5}/{self.lines:<5}{lines:6.2f} %   "
                f"{self.branches_taken:5}/{self.branches:<5}{branches:6.2f} %")


def figures_of(folder, lines, excused):
    """Figures by path, and those of all files together."""
    files, total = collections.defaultdict(Figures), Figures()
    left_out = set(excused) if folder.excuses else set()
    for place in sorted(set(lines) - left_out):
        files[place[0]].add(lines[place])
        total.add(lines[place])
    return files, total


def shortfalls(folder, total):
    line_share, branch_share = total.shares()
    found = []
    if line_share < folder.least_lines:
        found.append(f"{folder.name}/: {line_share:.2f} % of the lines, not {folder.least_lines} %")
    if branch_share < folder.least_branches:
        found.append(f"{folder.name}/: {branch_share:.2f} % of the branches, not "
                     f"{folder.least_branches} %")
    return found


def report(folder, lines, excused):
    """Prints the table of a folder; gives its figures."""
    files, total = figures_of(folder, lines, excused)
    print(f"\n{folder.name}/ by {' and '.join(folder.programs)}")
    print(f"  {'':38}lines                 branches (none of exceptions or brackets)")
    for path, figures in sorted(files.items()):
        print(f"  {path:38}{figures.text()}")
    print(f"  {'all':38}{total.text()}")
    for place in sorted(excused):
        if place[0].startswith(folder.name + "/"):
            left = "left out" if folder.excuses else "counted as not reached"
            print(f"  {left}: {place[0]}:{place[1]}: {excused[place]}")
    return total


def print_uncovered(lines, excused):
    for (path, number), line in sorted(lines.items()):
        if complete(line) or (path, number) in excused:
            continue
        text = (ROOT / path).read_text(encoding="utf-8").splitlines()[number - 1].strip()
        what = "never" if line.count == 0 else f"branches {line.branches}"
        print(f"  {path}:{number}: {what}: {text}")


def arguments():
    parser = argparse.ArgumentParser(description=__doc__.splitlines()[0])
    parser.add_argument("--build", type=pathlib.Path, default=ROOT / "build" / "coverage")
    parser.add_argument("--jobs", type=int, default=os.cpu_count())
    parser.add_argument("--no-build", action="store_true", help="the programs are built already")
    parser.add_argument("--no-run", action="store_true", help="... and have run already")
    parser.add_argument("--uncovered", action="store_true", help="print what is not reached")
    return parser.parse_args()


def main():
    options = arguments()
    build_folder = options.build.resolve()
    if not options.no_build and not options.no_run:
        build(build_folder, options.jobs)
    if not options.no_run:
        run_tests(build_folder)

    by_folder = {folder: lines_of(folder, build_folder) for folder in FOLDERS}
    all_lines = {place: line for lines in by_folder.values() for place, line in lines.items()}
    excused, wrong = excused_lines(excuses(LIST.read_text(encoding="utf-8")), all_lines)
    for folder, lines in by_folder.items():
        wrong += shortfalls(folder, report(folder, lines, excused))
        if options.uncovered:
            print_uncovered(lines, excused)
    print()
    for finding in wrong:
        print(finding)
    sys.exit(1 if wrong else 0)


if __name__ == "__main__":
    main()
