"""The small changes that can be made in a source."""
import collections
import dataclasses
import errno
import re
import zlib

from clang import cindex

# The functions of included headers are not looked into: their bodies take half of the time.
PREAMBLE_ON_FIRST_PARSE, SKIP_ONLY_IN_PREAMBLE = 0x100, 0x800  # which Debian 12's cindex does not name
OPTIONS = (cindex.TranslationUnit.PARSE_SKIP_FUNCTION_BODIES | cindex.TranslationUnit.PARSE_PRECOMPILED_PREAMBLE |
           PREAMBLE_ON_FIRST_PARSE | SKIP_ONLY_IN_PREAMBLE)

Cursor = cindex.CursorKind
Token = cindex.TokenKind

COMPARISONS = {'==': '!=', '!=': '==', '<': '<=', '<=': '<', '>': '>=', '>=': '>'}
LOGIC = {'&&': '||', '||': '&&'}
FLAGS = {'true': 'false', 'false': 'true'}
EXITS = {'EXIT_SUCCESS': 'EXIT_FAILURE', 'EXIT_FAILURE': 'EXIT_SUCCESS'}
ERRORS = set(errno.errorcode.values())

# What a text has besides plain characters, which are the ones that are changed.
SPECIAL = re.compile(r'\\(?:[0-7]{1,3}|x[0-9A-Fa-f]+|.)|'
                     r'%[-+ #0]*[\d*]*(?:\.[\d*]+)?(?:hh|h|ll|l|z|j|t)?[A-Za-z%]', re.S)

STATEMENTS = {
    Cursor.CALL_EXPR, Cursor.BINARY_OPERATOR, Cursor.UNARY_OPERATOR, Cursor.COMPOUND_ASSIGNMENT_OPERATOR,
    Cursor.CXX_DELETE_EXPR, Cursor.UNEXPOSED_EXPR, Cursor.CSTYLE_CAST_EXPR, Cursor.PAREN_EXPR,
    Cursor.CXX_THROW_EXPR, Cursor.BREAK_STMT, Cursor.CONTINUE_STMT,
}


@dataclasses.dataclass(frozen=True)
class Mutant:
    """One change: the bytes of a file from `start` to `end` become `new`."""
    file: str
    start: int
    end: int
    line: int
    column: int
    kind: str
    old: str
    new: str
    line_text: str
    nth: int = 1  # of the changes in the line that read the same

    @property
    def change(self):
        return f'{self.kind} {flat(self.old)} -> {flat(self.new)}' + (f' ({self.nth})' if self.nth > 1 else '')

    @property
    def name(self):
        return f'{self.file}:{self.line}:{self.column} {self.change}'

    def apply(self, source):
        return source[:self.start] + self.new.encode('latin-1') + source[self.end:]


def flat(text):
    """One line of limited length, and never empty."""
    text = ' '.join(text.split()) or 'nothing'
    if len(text) > 90:
        # Two long texts that begin alike stay different.
        text = f'{text[:80]}...{zlib.crc32(text.encode()):08x}'
    return text


def changed_text(literal):
    """The string literal with one plain character changed; which one depends on the text alone."""
    raw = re.fullmatch(r'(\w*R"(?P<mark>[^(]*)\()(.*)(\)(?P=mark)")', literal, re.S)
    plain = re.fullmatch(r'(\w*")(.*)(")', literal, re.S)
    if raw:
        before, text, after = raw.group(1), raw.group(3), raw.group(4)
        special = []
    elif plain:
        before, text, after = plain.groups()
        special = [match.span() for match in SPECIAL.finditer(text)]
    else:
        return None
    places = [i for i in range(len(text)) if not any(first <= i < last for first, last in special)]
    if not places:
        return before + 'x' + text + after
    place = places[zlib.crc32(text.encode()) % len(places)]
    old = text[place]
    if old in 'zZ':
        new = chr(ord(old) - 25)
    elif old == '9':
        new = '0'
    elif old.isalnum():
        new = chr(ord(old) + 1)
    else:
        new = '_' if old != '_' else '-'
    return before + text[:place] + new + text[place + 1:] + after


def moved_constant(literal):
    """The integer literal moved by one; in which direction depends on its value."""
    match = re.fullmatch(r"(0[xX][0-9A-Fa-f']+|0[bB][01']+|[0-9][0-9']*)([uUlLzZ]*)", literal)
    if not match:
        return None  # a floating-point number
    digits, suffix = match.group(1).replace("'", ''), match.group(2)
    if digits[:2].lower() in ('0x', '0b'):
        value = int(digits, 0)
    else:
        value = int(digits, 8 if digits.startswith('0') else 10)
    moved = value - 1 if zlib.crc32(digits.encode()) % 2 and value > 0 else value + 1
    return f'{moved}{suffix}'


def moved_character(literal):
    match = re.fullmatch(r"'(.)'", literal)
    if match:
        new = chr(ord(match.group(1)) + 1)
        return f"'\\{new}'" if new in "'\\" else f"'{new}'"
    simple = {r'\0': 1, r'\n': 11, r'\t': 10, r'\r': 14, r'\\': 0x5d, r"\'": 0x28}
    octal = re.fullmatch(r"'\\([0-7]+)'", literal)
    hexadecimal = re.fullmatch(r"'\\x([0-9A-Fa-f]+)'", literal)
    if literal[1:-1] in simple:
        value = simple[literal[1:-1]]
    elif octal:
        value = int(octal.group(1), 8) + 1
    elif hexadecimal:
        value = int(hexadecimal.group(1), 16) + 1
    else:
        return None
    return f"'\\{value & 0xff:03o}'"


class Source:
    """The candidates of one file."""

    def __init__(self, path, name, arguments):
        """`name` stands for the file in mutants; `arguments` are those of the compiler."""
        self.name = name
        with open(path, 'rb') as file:
            self.bytes = file.read()
        self.text = self.bytes.decode('latin-1')  # so that offsets are those of the bytes
        self.lines = self.text.split('\n')
        self.starts = [0]
        for line in self.lines:
            self.starts.append(self.starts[-1] + len(line) + 1)
        # A preamble loses "#pragma GCC visibility push", which is in headers only.
        options = 0 if path.endswith('.h') else OPTIONS
        unit = cindex.Index.create().parse(path, args=['-x', 'c++', *arguments], options=options)
        errors = [str(d) for d in unit.diagnostics if d.severity >= cindex.Diagnostic.Error]
        if errors:
            raise ValueError(f'{name} does not parse: {errors[0]}')
        self.path = path
        self.found = {}
        self.tokens = self.code_tokens(unit)
        self.by_start = {token[1]: index for index, token in enumerate(self.tokens)}
        self.by_end = {token[2]: index for index, token in enumerate(self.tokens)}
        self.add_of_tokens()
        for child in unit.cursor.get_children():
            if child.location.file is not None and child.location.file.name == path:
                self.walk(child, None)

    @property
    def mutants(self):
        seen = collections.Counter()
        numbered = []
        for mutant in sorted(self.found.values(), key=lambda m: (m.start, m.end, m.kind, m.new)):
            seen[mutant.line, mutant.change] += 1
            numbered.append(dataclasses.replace(mutant, nth=seen[mutant.line, mutant.change]))
        return numbered

    def add(self, start, end, kind, new):
        line = self.text.count('\n', 0, start)
        column = start - self.starts[line] + 1
        old = self.text[start:end]
        self.found[start, end, new] = Mutant(
            self.name, start, end, line + 1, column, kind, old, new, ' '.join(self.lines[line].split()))

    # ---- Tokens ----

    def code_tokens(self, unit):
        """(spelling, start, end, kind) of each token outside of comments, directives and attributes."""
        tokens = []
        for token in unit.get_tokens(extent=unit.cursor.extent):
            if token.kind == Token.COMMENT:
                continue
            start, end = token.extent.start.offset, token.extent.end.offset
            tokens.append((self.text[start:end], start, end, token.kind))
        kept = []
        directive_end = -1
        index = 0
        while index < len(tokens):
            spelling, start, end, kind = tokens[index]
            line = self.text.rfind('\n', 0, start) + 1
            if spelling == '#' and self.text[line:start].strip() == '':
                directive_end = start
                while True:
                    directive_end = self.text.find('\n', directive_end)
                    if directive_end < 0 or self.text[directive_end - 1] != '\\':
                        break
                    directive_end += 1
                if directive_end < 0:
                    directive_end = len(self.text)
            if start < directive_end:
                index += 1
                continue
            following = tokens[index + 1][0] if index + 1 < len(tokens) else ''
            if re.fullmatch(r'static_assert|__attribute__|alignas|\w+_FORMAT', spelling) and following == '(':
                index = self.closing(tokens, index + 1) + 1
                continue
            if spelling == '[' and following == '[' and tokens[index + 1][1] == end:
                index = self.closing(tokens, index) + 1
                continue
            if spelling == 'extern' and following.startswith('"'):
                index += 2
                continue
            kept.append(tokens[index])
            index += 1
        return kept

    @staticmethod
    def closing(tokens, index):
        """The index of the bracket that closes the one at `index`."""
        depth = 0
        for at in range(index, len(tokens)):
            if tokens[at][0] in '([{':
                depth += 1
            elif tokens[at][0] in ')]}':
                depth -= 1
                if depth == 0:
                    return at
        return len(tokens) - 1

    def is_between_blanks(self, start, end):
        """clang-format puts blanks around binary operators only, not around the brackets and references of types."""
        return self.text[start - 1].isspace() and self.text[end:end + 1].isspace()

    def add_of_tokens(self):
        for index, (spelling, start, end, kind) in enumerate(self.tokens):
            previous = self.tokens[index - 1][0] if index else ''
            if previous == 'operator':
                continue
            if spelling in COMPARISONS and self.is_between_blanks(start, end):
                self.add(start, end, 'comparison', COMPARISONS[spelling])
            elif spelling in LOGIC and self.is_between_blanks(start, end):
                self.add(start, end, 'logic', LOGIC[spelling])
            elif spelling in FLAGS and previous not in ('noexcept',):
                self.add(start, end, 'constant', FLAGS[spelling])
            elif spelling in EXITS:
                self.add(start, end, 'code', EXITS[spelling])
            elif spelling in ERRORS:
                self.add(start, end, 'code', 'EIO' if spelling != 'EIO' else 'EINVAL')
            elif kind == Token.LITERAL:
                self.add_of_literal(spelling, start, end)
            elif spelling in ('if', 'while'):
                self.add_of_condition(index)
            elif spelling == 'for':
                self.add_of_loop(index)

    def add_of_literal(self, spelling, start, end):
        if spelling.endswith('"'):
            new = changed_text(spelling)
            if new:
                self.add(start, end, 'text', new)
        elif spelling.startswith("'"):
            new = moved_character(spelling)
            if new:
                self.add(start, end, 'constant', new)
        else:
            new = moved_constant(spelling)
            if new:
                self.add(start, end, 'constant', new)

    def parts(self, opening):
        """The parts between the brackets at that index, separated by semicolons, as pairs of indexes."""
        closing = self.closing(self.tokens, opening)
        parts, first, depth = [], opening + 1, 0
        for at in range(opening + 1, closing):
            if self.tokens[at][0] in '([{':
                depth += 1
            elif self.tokens[at][0] in ')]}':
                depth -= 1
            elif self.tokens[at][0] == ';' and depth == 0:
                parts.append((first, at))
                first = at + 1
        return parts + [(first, closing)]

    def declares(self, first, last):
        depth = 0
        for at in range(first, last):
            depth += {'(': 1, '[': 1, '{': 1, ')': -1, ']': -1, '}': -1}.get(self.tokens[at][0], 0)
            if depth == 0 and self.tokens[at][0] == '=':
                return True
        return False

    def negate(self, first, last):
        spellings = [self.tokens[at][0] for at in range(first, last)]
        is_turned = not LOGIC.keys() & spellings and spellings.count('==') + spellings.count('!=') == 1
        if spellings and not self.declares(first, last) and not is_turned:  # turning the comparison does the same
            start, end = self.tokens[first][1], self.tokens[last - 1][2]
            self.add(start, end, 'condition', f'!({self.text[start:end]})')

    def add_of_condition(self, index):
        index += 1
        if index < len(self.tokens) and self.tokens[index][0] == 'constexpr':
            index += 1
        if index < len(self.tokens) and self.tokens[index][0] == '(':
            self.negate(*self.parts(index)[-1])

    def add_of_loop(self, index):
        parts = self.parts(index + 1)
        if len(parts) == 3:
            self.negate(*parts[1])

    # ---- Cursors ----

    def walk(self, cursor, function):
        kind = cursor.kind
        if kind in (Cursor.FUNCTION_DECL, Cursor.CXX_METHOD, Cursor.CONSTRUCTOR, Cursor.DESTRUCTOR,
                    Cursor.FUNCTION_TEMPLATE, Cursor.CONVERSION_FUNCTION, Cursor.LAMBDA_EXPR):
            function = cursor
        children = list(cursor.get_children())
        if kind == Cursor.COMPOUND_STMT:
            for child in children:
                self.add_of_statement(child, function)
        elif kind == Cursor.IF_STMT:
            for child in children[1:]:
                self.add_of_statement(child, function)
        elif kind in (Cursor.WHILE_STMT, Cursor.FOR_STMT, Cursor.CXX_FOR_RANGE_STMT, Cursor.CASE_STMT,
                      Cursor.DEFAULT_STMT) and children:
            self.add_of_statement(children[-1], function)
        elif kind == Cursor.CONDITIONAL_OPERATOR and len(children) == 3:
            self.add_of_choice(children[0])
        elif kind == Cursor.DECL_REF_EXPR:
            self.add_of_enumerator(cursor)
        for child in children:
            if child.kind != Cursor.LAMBDA_EXPR or kind != Cursor.LAMBDA_EXPR:
                self.walk(child, function)

    def add_of_choice(self, condition):
        first = self.by_start.get(condition.extent.start.offset)
        last = self.by_end.get(condition.extent.end.offset)
        if first is not None and last is not None and self.tokens[last + 1][0] == '?':
            self.negate(first, last + 1)

    def add_of_enumerator(self, cursor):
        constant = cursor.referenced
        if constant is None or constant.kind != Cursor.ENUM_CONSTANT_DECL:
            return
        where = constant.location.file
        if where is None or where.name.startswith('/usr/'):
            return
        names = [c.spelling for c in constant.semantic_parent.get_children() if c.kind == Cursor.ENUM_CONSTANT_DECL]
        at = self.by_end.get(cursor.extent.end.offset)
        if len(names) < 2 or at is None or self.tokens[at][0] != constant.spelling:
            return
        following = names[(names.index(constant.spelling) + 1) % len(names)]
        self.add(self.tokens[at][1], self.tokens[at][2], 'code', following)

    def begins_statement(self, start):
        index = self.by_start.get(start)
        return index is not None and index > 0 and self.tokens[index - 1][0] in ('{', '}', ';', ')', 'else', ':', 'do')

    def add_of_statement(self, cursor, function):
        start, end = cursor.extent.start.offset, cursor.extent.end.offset
        if not self.begins_statement(start):
            return
        kind = cursor.kind
        first = self.tokens[self.by_start[start]][0]
        is_macro = kind == Cursor.DO_STMT and first != 'do' or kind == Cursor.NULL_STMT and first != ';'
        if kind == Cursor.DECL_STMT:
            self.add_of_owner(cursor, function)
        elif kind == Cursor.RETURN_STMT:
            if self.text[start:end] == 'return' and self.text[end:end + 1] == ';':
                self.add(start, end, 'statement', '')
        elif (kind in STATEMENTS or is_macro) and re.match(r'\s*;', self.text[end:]):
            self.add(start, end, 'statement', '')

    def add_of_owner(self, cursor, function):
        """An object that works by its constructor and destructor alone: nothing else names it."""
        declared = list(cursor.get_children())
        if function is None or len(declared) != 1 or declared[0].kind != Cursor.VAR_DECL:
            return
        kind = declared[0].type.get_canonical().kind
        if kind not in (cindex.TypeKind.RECORD, cindex.TypeKind.UNEXPOSED, cindex.TypeKind.DEPENDENT):
            return
        first, last = function.extent.start.offset, function.extent.end.offset
        uses = sum(1 for token in self.tokens if token[0] == declared[0].spelling and first <= token[1] < last)
        start, end = cursor.extent.start.offset, cursor.extent.end.offset
        if uses == 1:
            self.add(start, end, 'statement', ';' if self.text[start:end].endswith(';') else '')


def candidates(path, name, arguments):
    """The mutants of a file, in the order of the file."""
    return Source(path, name, arguments).mutants
