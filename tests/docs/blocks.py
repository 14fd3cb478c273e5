"""The blocks of a document, and running them as a reader would: in a folder of scratch data, without the variables that
change what the library does."""

import os
import re
import subprocess

MOST_SECONDS = 120


class Build:
    """Where the programs and libraries are that the documents describe."""

    def __init__(self, source, libraries, tools, compiler):
        self.source, self.libraries, self.tools = map(os.path.realpath, (source, libraries, tools))
        self.compiler = compiler

    def run(self, command, folder):
        """Returns the exit status, and what was printed on both streams."""
        kept = {name: value for name, value in os.environ.items()
                if not name.startswith(("TRC_", "PRINT_DEBUG", "LD_", "LTTNG_", "VRA_"))}
        environment = {**kept, "PATH": self.tools + ":" + os.environ["PATH"], "LC_ALL": "C", "TZ": "UTC"}
        result = subprocess.run(command, cwd=folder, env=environment, stdin=subprocess.DEVNULL,
                                text=True, stdout=subprocess.PIPE, stderr=subprocess.STDOUT,
                                timeout=MOST_SECONDS, check=False)
        return result.returncode, result.stdout

    def shell(self, commands, folder):
        return self.run(["bash", "-euo", "pipefail", "-c", commands], folder)

    def compile(self, language, program, folder):
        """Makes the program `program` in the folder."""
        name = "program." + language
        with open(os.path.join(folder, name), "w", encoding="utf-8") as file:
            file.write(program)
        standard = ["-x", "c"] if language == "c" else ["-std=c++17"]
        trace = ["-ltrc"] if "ldtr.h" in program else []
        return self.run(
            [self.compiler, *standard, "-Wall", "-Wextra", "-Wpedantic", "-Werror", name, "-x", "none",
             "-o", "program", f"-I{self.source}/libosutils", f"-I{self.source}/libldtr",
             f"-L{self.libraries}", f"-L{self.libraries}/osutils", "-Wl,--enable-new-dtags",
             f"-Wl,-rpath,{self.libraries}:{self.libraries}/osutils", "-losutils", *trace], folder)

    def check(self, language, block, expected, folder):
        """Runs commands or a program. Returns what is wrong, or None. `expected` may be None."""
        if language == "sh":
            status, printed = self.shell(block, folder)
        else:
            status, printed = self.compile(language, block, folder)
            if status == 0:
                status, printed = self.run(["./program"], folder)
        if status != 0:
            return f"status {status}:\n{printed}"
        if expected is not None and not matches(expected, printed):
            return f"expected:\n{expected}printed:\n{printed}"
        return None


def read(document):
    with open(document, encoding="utf-8") as file:
        return file.read()


def blocks(text):
    """The (language, text) of each fenced block."""
    return [(match[1], match[2]) for match in re.finditer(r"^```(\w*)\n(.*?)^```$", text, re.M | re.S)]


def with_output(text):
    """The (language, text, expected output or None) of each block that can be run."""
    found = blocks(text) + [("", "")]
    return [(language, block, found[number + 1][1] if found[number + 1][0] == "text" else None)
            for number, (language, block) in enumerate(found) if language in ("sh", "c", "cpp")]


def sections(text, level="##"):
    """What is before the first heading of this level, and the (title, text) of each."""
    start, *parts = re.split(rf"^{level} ", text, flags=re.M)
    return start, [part.split("\n", 1) for part in parts]


def matches(expected, printed):
    """`…` stands for any text of one line."""
    return re.fullmatch("[^\n]+".join(map(re.escape, expected.split("…"))), printed) is not None


def report(failures, done):
    print("\n".join(failures) if failures else done)
    return 1 if failures else 0
