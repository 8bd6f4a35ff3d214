#include "daemons/searchgw/query_string.hpp"

#include <cctype>
#include <utility>

namespace orvane {
namespace searchgw {
namespace {

// Deep enough for any query a person or a client builds, shallow enough that a hostile one
// cannot exhaust the stack of a recursive descent.
constexpr int kMaxDepth = 64;

struct Token {
  enum Type { kWord, kPhrase, kColon, kLParen, kRParen, kRangeOpen, kRangeClose, kEnd };
  Type type = kEnd;
  std::string text;      // kWord and kPhrase: escapes resolved; brackets: the bracket
  bool escaped = false;  // kWord: held a backslash escape, so it is never an operator
  size_t pos = 0;        // offset in the query, for messages
};

bool IsSpecial(char c, bool in_value) {
  switch (c) {
    case '(':
    case ')':
    case '[':
    case ']':
    case '{':
    case '}':
    case '"':
      return true;
    case ':':
      // Times ("2024-01-02T10:00:00Z") carry colons; where a value stands, no field name can.
      return !in_value;
    default:
      return std::isspace(static_cast<unsigned char>(c)) != 0;
  }
}

class Tokenizer {
 public:
  explicit Tokenizer(const std::string& text) : text_(text) {}

  std::vector<Token> Run() {
    std::vector<Token> out;
    for (;;) {
      while (pos_ < text_.size() && std::isspace(static_cast<unsigned char>(text_[pos_]))) ++pos_;
      Token t;
      t.pos = pos_;
      if (pos_ == text_.size()) {
        out.push_back(t);
        return out;
      }
      const char c = text_[pos_];
      if (c == '(' || c == ')' || c == ':') {
        t.type = c == '(' ? Token::kLParen : c == ')' ? Token::kRParen : Token::kColon;
        ++pos_;
      } else if (c == '[' || c == '{') {
        t.type = Token::kRangeOpen;
        t.text = c;
        in_range_ = true;
        ++pos_;
      } else if (c == ']' || c == '}') {
        t.type = Token::kRangeClose;
        t.text = c;
        in_range_ = false;
        ++pos_;
      } else if (c == '"') {
        t.type = Token::kPhrase;
        t.text = Phrase();
      } else {
        t.type = Token::kWord;
        const bool in_value = in_range_ || (!out.empty() && out.back().type == Token::kColon);
        t.text = Word(in_value, &t.escaped);
      }
      out.push_back(std::move(t));
    }
  }

 private:
  std::string Word(bool in_value, bool* escaped) {
    std::string w;
    while (pos_ < text_.size() && !IsSpecial(text_[pos_], in_value)) {
      if (text_[pos_] == '\\') {
        if (pos_ + 1 == text_.size()) {
          throw QuerySyntaxError("the query ends with a lone backslash at position " +
                                 std::to_string(pos_));
        }
        *escaped = true;
        ++pos_;
      }
      w += text_[pos_++];
    }
    return w;
  }

  std::string Phrase() {
    const size_t start = pos_++;
    std::string p;
    while (pos_ < text_.size() && text_[pos_] != '"') {
      if (text_[pos_] == '\\' && pos_ + 1 < text_.size()) ++pos_;
      p += text_[pos_++];
    }
    if (pos_ == text_.size()) {
      throw QuerySyntaxError("the quote at position " + std::to_string(start) + " is never closed");
    }
    ++pos_;
    return p;
  }

  const std::string& text_;
  size_t pos_ = 0;
  bool in_range_ = false;
};

class Parser {
 public:
  explicit Parser(std::vector<Token> tokens) : tokens_(std::move(tokens)) {}

  QueryNode Run() {
    QueryNode n = Or("", 0);
    if (Peek().type != Token::kEnd) Fail("an operator or the end of the query");
    return n;
  }

 private:
  const Token& Peek() const { return tokens_[at_]; }
  Token Take() { return tokens_[at_ == tokens_.size() - 1 ? at_ : at_++]; }
  bool IsOp(const char* op) const {
    const Token& t = Peek();
    return t.type == Token::kWord && !t.escaped && t.text == op;
  }
  bool StartsOperand() const {
    switch (Peek().type) {
      case Token::kWord:
        return !IsOp("AND") && !IsOp("OR");
      case Token::kPhrase:
      case Token::kLParen:
      case Token::kRangeOpen:
        return true;
      default:
        return false;
    }
  }

  [[noreturn]] void Fail(const std::string& expected) const {
    const Token& t = Peek();
    std::string seen = t.type == Token::kEnd
                           ? "the end of the query"
                           : "\"" + Describe(t) + "\" at position " + std::to_string(t.pos);
    throw QuerySyntaxError("expected " + expected + ", found " + seen);
  }
  static std::string Describe(const Token& t) {
    switch (t.type) {
      case Token::kColon:
        return ":";
      case Token::kLParen:
        return "(";
      case Token::kRParen:
        return ")";
      case Token::kPhrase:
        return "\"" + t.text + "\"";
      default:
        return t.text;
    }
  }

  static QueryNode Join(QueryNode::Kind kind, std::vector<QueryNode> parts) {
    if (parts.size() == 1) return std::move(parts.front());
    QueryNode n;
    n.kind = kind;
    n.children = std::move(parts);
    return n;
  }

  static void CheckDepth(int depth) {
    if (depth > kMaxDepth) {
      throw QuerySyntaxError("the query nests deeper than " + std::to_string(kMaxDepth) +
                             " levels");
    }
  }

  QueryNode Or(const std::string& field, int depth) {
    CheckDepth(depth);
    std::vector<QueryNode> parts{And(field, depth)};
    for (;;) {
      if (IsOp("OR")) {
        Take();
      } else if (!StartsOperand()) {
        break;
      }
      parts.push_back(And(field, depth));
    }
    return Join(QueryNode::kOr, std::move(parts));
  }

  QueryNode And(const std::string& field, int depth) {
    std::vector<QueryNode> parts{Unary(field, depth)};
    while (IsOp("AND")) {
      Take();
      parts.push_back(Unary(field, depth));
    }
    return Join(QueryNode::kAnd, std::move(parts));
  }

  QueryNode Unary(const std::string& field, int depth) {
    if (IsOp("NOT")) {
      CheckDepth(depth);
      Take();
      QueryNode n;
      n.kind = QueryNode::kNot;
      n.children.push_back(Unary(field, depth + 1));
      return n;
    }
    return Primary(field, depth);
  }

  QueryNode Primary(const std::string& field, int depth) {
    switch (Peek().type) {
      case Token::kLParen: {
        Take();
        QueryNode n = Or(field, depth + 1);
        if (Peek().type != Token::kRParen) Fail("\")\"");
        Take();
        return n;
      }
      case Token::kRangeOpen:
        if (field.empty()) Fail("a field before the range");
        return Range(field);
      case Token::kPhrase: {
        QueryNode n;
        n.kind = QueryNode::kPhrase;
        n.field = field;
        n.text = Take().text;
        return n;
      }
      case Token::kWord:
        if (StartsOperand()) break;
        [[fallthrough]];
      default:
        Fail("a term, a phrase or \"(\"");
    }
    Token word = Take();
    if (Peek().type != Token::kColon) {
      QueryNode n;
      n.field = field;
      n.text = std::move(word.text);
      return n;
    }
    if (!field.empty()) Fail("a term (a field inside field:(...) is not allowed)");
    Take();
    if (word.text.empty()) Fail("a field name");
    switch (Peek().type) {
      case Token::kLParen:
      case Token::kRangeOpen:
      case Token::kPhrase:
      case Token::kWord:
        if (Peek().type == Token::kWord && !StartsOperand()) break;
        return Primary(word.text, depth);
      default:
        break;
    }
    Fail("a value after \"" + word.text + ":\"");
  }

  QueryNode Range(const std::string& field) {
    QueryNode n;
    n.kind = QueryNode::kRange;
    n.field = field;
    n.low_included = Take().text == "[";
    auto bound = [&](std::string* out) {
      if (Peek().type != Token::kWord && Peek().type != Token::kPhrase) Fail("a range bound");
      *out = Take().text;
    };
    bound(&n.low);
    if (!(Peek().type == Token::kWord && !Peek().escaped && Peek().text == "TO")) Fail("\"TO\"");
    Take();
    bound(&n.high);
    if (Peek().type != Token::kRangeClose) Fail("\"]\" or \"}\"");
    n.high_included = Take().text == "]";
    return n;
  }

  std::vector<Token> tokens_;
  size_t at_ = 0;
};

}  // namespace

QueryNode ParseQueryString(const std::string& text) { return Parser(Tokenizer(text).Run()).Run(); }

}  // namespace searchgw
}  // namespace orvane
