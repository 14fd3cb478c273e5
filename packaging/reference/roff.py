"""Pages for man(1): what is common to those of the library and those of the tool."""
import re
import textwrap


def escaped(text, literal=False):
    """Text as groff reads it. Literal text has no typographic quotes and hyphens."""
    text = text.replace("\\", "\\e")
    if literal:
        for character, name in (("'", "\\(aq"), ("`", "\\(ga"), ("-", "\\-"), ("^", "\\(ha"), ("~", "\\(ti")):
            text = text.replace(character, name)
        return text
    text = re.sub(r"(?<![A-Za-z0-9])-(?=[A-Za-z0-9-])|(?<=-)-", r"\\-", text)  # signs and options
    return text.replace("^", "\\(ha").replace("~", "\\(ti")


def argument(text):
    """An argument of a macro."""
    return '"' + escaped(text, literal=True).replace('"', "\\(dq") + '"'


class Page:
    def __init__(self, name, section, date, version, manual="libosutils"):
        self.lines = [f".TH {argument(name)} {section} {date} {argument('libosutils ' + version)} {argument(manual)}",
                      ".nh", ".ad l"]

    def section(self, title):
        self.lines.append(f".SH {argument(title)}")

    def subsection(self, title):
        self.lines.append(f".SS {argument(title)}")

    def paragraph(self, text):
        if not self.lines[-1].startswith((".SH", ".SS")):
            self.lines.append(".PP")
        self.text(text)

    def text(self, text):
        """Words; those in \\1 ... \\2 are literal and printed bold."""
        words = []
        for i, part in enumerate(re.split("\1([^\2]*)\2", text)):
            if i % 2:
                words.append("\\fB" + escaped(part, literal=True).replace(" ", "\\ ") + "\\fR")
            else:
                words.append(escaped(part))
        for line in textwrap.wrap("".join(words), 78, break_long_words=False, break_on_hyphens=False):
            self.lines.append("\\&" + line if line.startswith((".", "'")) else line)

    def item(self, term, text):
        self.lines.append(".TP")
        self.lines.append("\\fB" + escaped(term, literal=True) + "\\fR")
        self.text(text or "(no text)")

    def literal(self, text):
        self.lines += [".PP", ".RS 4", ".nf"] if not self.lines[-1].startswith((".SH", ".SS")) else [".RS 4", ".nf"]
        for line in text.rstrip("\n").split("\n"):
            line = escaped(line, literal=True)
            self.lines.append("\\&" + line if line.startswith((".", "'")) else line)
        self.lines += [".fi", ".RE"]

    def see_also(self, pages):
        self.section("SEE ALSO")
        for i, (name, section) in enumerate(pages):
            self.lines.append(f".BR {argument(name)[1:-1]} ({section}){',' if i + 1 < len(pages) else ''}")

    def __str__(self):
        return "\n".join(self.lines) + "\n"
