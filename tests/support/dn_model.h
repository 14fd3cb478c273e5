#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

// A reference model of the distinguished-name formatter, for comparing its results with those of
// the real formatter. It is built in another shape on purpose: the name is cut into tokens, the
// tokens are gathered into components (type, value, separator), and the components are written
// out. A mistake in the bookkeeping of a character-by-character rewrite in place therefore has no
// counterpart here that could hide it.

// What one token means when it stands by itself.
enum class DnTokenKind {
  kEscapePair,  // A backslash and the character it escapes.
  kSeparator,   // Comma, semicolon or plus.
  kEquals,
  kQuote,
  kBlank,  // Space or line feed; other white space is ordinary text.
  kOther,  // Everything else, also a lone backslash at the end of the name.
};

// `ch` is the character itself; for an escape pair it is the character after the backslash.
struct DnToken {
  DnTokenKind kind;
  char ch;
};

// One "type=value" with the separator that ended it. The texts are already cleaned.
struct DnComponent {
  std::string type;
  bool hasEquals = false;  // False when the name ends inside the type.
  std::string value;       // Including the quotes of a quoted value.
  std::string separator;   // Empty when the name ends with this component.
};

inline DnTokenKind dnKindOf(char ch) {
  switch (ch) {
    case ',':
    case ';':
    case '+':
      return DnTokenKind::kSeparator;
    case '=':
      return DnTokenKind::kEquals;
    case '"':
      return DnTokenKind::kQuote;
    case ' ':
    case '\n':
      return DnTokenKind::kBlank;
    default:
      return DnTokenKind::kOther;
  }
}

// Pairing every backslash with its successor from the very beginning of the name is right although
// escapes have a meaning only in values: a value always starts after an "=" or a blank, so that no
// backslash of a type can reach into it, and a type always starts after a separator.
inline std::vector<DnToken> dnTokensOf(std::string_view dn) {
  std::vector<DnToken> tokens;
  for (std::size_t i = 0; i < dn.size(); ++i) {
    if (dn[i] == '\\' && i + 1 < dn.size()) {
      ++i;
      tokens.push_back({DnTokenKind::kEscapePair, dn[i]});
    } else {
      tokens.push_back({dnKindOf(dn[i]), dn[i]});
    }
  }
  return tokens;
}

// The text an escape pair leaves in a value. Only these four characters keep their backslash; an
// escaped semicolon or plus loses it, and so does an escaped blank.
inline std::string dnUnescaped(char ch) {
  const bool keepsBackslash = ch == '\\' || ch == '"' || ch == '=' || ch == ',';
  return keepsBackslash ? std::string{'\\', ch} : std::string{ch};
}

// Reads components off a list of tokens. Every take...() function starts at the current token and
// leaves the position behind what it has taken.
class DnComponentReader {
 public:
  explicit DnComponentReader(std::vector<DnToken> tokens) : tokens_(std::move(tokens)) {}

  bool atEnd() const { return next_ == tokens_.size(); }

  DnComponent takeComponent() {
    DnComponent component;
    takeType(component);
    if (!component.hasEquals) return component;
    skipBlanks();
    if (!atEnd() && tokens_[next_].kind == DnTokenKind::kQuote) {
      takeQuotedValue(component);
      takeRestAfterQuote(component);
    } else {
      takeUnquotedValue(component);
    }
    return component;
  }

 private:
  // Skips blanks that are not escaped. For the start of a type this is right as well: there an
  // escaped blank begins with its backslash, which is the first character of the type.
  void skipBlanks() {
    while (!atEnd() && tokens_[next_].kind == DnTokenKind::kBlank) ++next_;
  }

  // A type ends only at "="; a separator or a quote in it is ordinary text. A backslash is ordinary
  // text too, so it protects neither an "=" nor a blank that follows it.
  void takeType(DnComponent& component) {
    skipBlanks();
    while (!atEnd() && !component.hasEquals) {
      const DnToken token = tokens_[next_++];
      if (token.kind == DnTokenKind::kEscapePair) component.type += '\\';
      // The first character of a type belongs to it whatever it is, even when it is an "=".
      const bool isFirst = component.type.empty();
      if (token.ch == '=' && !isFirst) {
        component.hasEquals = true;
      } else if (dnKindOf(token.ch) != DnTokenKind::kBlank) {
        component.type += token.ch;
      }
    }
  }

  // An unquoted value ends at the first separator that is not escaped.
  void takeUnquotedValue(DnComponent& component) {
    // The first character of a value belongs to it whatever it is, even when it is a separator.
    bool isFirst = true;
    while (!atEnd()) {
      const DnToken token = tokens_[next_++];
      if (token.kind == DnTokenKind::kSeparator && !isFirst) {
        removeTrailingBlanks(component.value);
        component.separator = token.ch == '+' ? "+" : ",";
        return;
      }
      component.value += textOf(token);
      isFirst = false;
    }
    // Blanks at the end of the whole name stay here: the final trim has rules of its own for them.
  }

  // Takes the opening quote, the text and, when there is one, the closing quote. Blanks and
  // separators between the quotes are ordinary text.
  void takeQuotedValue(DnComponent& component) {
    component.value = "\"";
    ++next_;
    while (!atEnd()) {
      const DnToken token = tokens_[next_++];
      component.value += textOf(token);
      if (token.kind == DnTokenKind::kQuote) return;
    }
  }

  // Drops everything up to the next separator. Escapes mean nothing here, so a separator after a
  // backslash counts as well. Unlike after an unquoted value a semicolon stays a semicolon.
  void takeRestAfterQuote(DnComponent& component) {
    while (!atEnd()) {
      const DnToken token = tokens_[next_++];
      if (dnKindOf(token.ch) == DnTokenKind::kSeparator) {
        component.separator = token.ch;
        return;
      }
    }
  }

  static std::string textOf(const DnToken& token) {
    if (token.kind == DnTokenKind::kEscapePair) return dnUnescaped(token.ch);
    return std::string{token.ch};
  }

  // Works on the text, not on the tokens: a blank that was escaped has lost its backslash by now
  // and goes like any other. This never reaches beyond the value, because the "=" before it is not
  // a blank.
  static void removeTrailingBlanks(std::string& text) {
    while (!text.empty() && dnKindOf(text.back()) == DnTokenKind::kBlank) text.pop_back();
  }

  std::vector<DnToken> tokens_;
  std::size_t next_ = 0;
};

// White space of the C locale. Written out so that the model does not depend on the locale of the
// program and takes bytes above 0x7F without a cast.
inline bool dnIsWhiteSpace(char ch) { return ch == ' ' || (ch >= '\t' && ch <= '\r'); }

// Removes white space of any sort from the end of the name, but stops at a white-space character
// with a backslash before it. That backslash need not be an escape of this character: it may just
// as well be the second half of an escaped backslash.
inline std::string_view dnTrimmed(std::string_view text) {
  while (!text.empty() && dnIsWhiteSpace(text.back())) {
    const std::string_view shorter = text.substr(0, text.size() - 1);
    if (!shorter.empty() && shorter.back() == '\\') break;
    text = shorter;
  }
  return text;
}

// Upper-cases the ASCII letters and leaves all other bytes as they are.
inline std::string dnUpperCased(std::string_view text) {
  std::string result(text);
  for (char& ch : result) {
    if (ch >= 'a' && ch <= 'z') ch = static_cast<char>(ch - 'a' + 'A');
  }
  return result;
}

// Returns the canonical form of `dn`. The name must not be empty, because the formatter gives no
// text at all for an empty one, and must not contain a zero byte, because that ends a name. The
// result is empty when the name has nothing but white space.
inline std::string modelOfFormattedDn(std::string_view dn) {
  DnComponentReader reader(dnTokensOf(dn));
  std::string text;
  while (!reader.atEnd()) {
    const DnComponent component = reader.takeComponent();
    text += component.type;
    if (component.hasEquals) text += '=';
    text += component.value + component.separator;
  }
  return dnUpperCased(dnTrimmed(text));
}
