// fastcond.cpp: simple conditions evaluated without the eval loop (see fastcond.h).
//
// The text is parsed by a small parser of its own that accepts only the shapes listed in the
// header and refuses everything else (the compiled code then answers). The parser runs only
// on text the interpreter has compiled, so it never has to report syntax errors: refusing is
// always safe. Evaluation follows the order of the compiled code (left to right, `and`/`or`
// cut short) and reaches objects only in ways that run no Python code: dictionary look-ups,
// an instance's own dictionary when its type has no attribute of that name, item access on
// exact lists, tuples, strings, bytes and dictionaries, and comparisons between exact built-in
// types. Anything else, or anything that fails, answers "undecided" with nothing changed, so
// the compiled code then gives the answer, including its error.
#include "bp/fastcond.h"

#include <cctype>
#include <cstring>
#include <string>
#include <vector>

#include "support/pycompat.h"
#include "support/ref.h"

namespace {

enum class NodeKind { kOr, kAnd, kNot, kCompare, kTruth };
enum class CompareOp { kLt, kLe, kEq, kNe, kGt, kGe, kIs, kIsNot, kIn, kNotIn };

// One step after a name: `.attribute` or `[constant]`.
struct Access {
  bool attribute;
  Ref key;  // owned: the attribute name or the subscript constant
};

// A name followed by accesses, or a constant.
struct Operand {
  Ref constant;  // owned: set for a constant
  Ref name;      // owned: set for a name
  std::vector<Access> accesses;
};

}  // namespace

struct FastCondition {
  NodeKind kind = NodeKind::kTruth;
  std::vector<FastCondition> children;  // kOr, kAnd: two or more; kNot: one
  CompareOp op = CompareOp::kEq;        // kCompare
  Operand left;                         // kCompare, kTruth
  Operand right;                        // kCompare
};

namespace {

// ---- Tokens ------------------------------------------------------------------------------

enum class TokenKind { kEnd, kName, kNumber, kString, kBytes, kOp, kBad };

struct Token {
  TokenKind kind = TokenKind::kEnd;
  std::string text;  // a name, a number's digits, a string's contents, an operator
};

constexpr const char* kKeywords[] = {
    "as",     "assert",   "async",  "await",   "break",  "class", "continue", "def",  "del",
    "elif",   "else",     "except", "finally", "for",    "from",  "global",   "if",   "import",
    "lambda", "nonlocal", "pass",   "raise",   "return", "try",   "while",    "with", "yield"};

bool is_reserved(const std::string& name) {
  for (const char* keyword : kKeywords) {
    if (name == keyword) return true;
  }
  return false;
}

bool is_name_start(char c) {
  return std::isalpha(static_cast<unsigned char>(c)) || c == '_';
}
bool is_name_char(char c) {
  return std::isalnum(static_cast<unsigned char>(c)) || c == '_';
}

class Lexer {
 public:
  explicit Lexer(const char* text) : at_(text) {}

  Token next() {
    while (*at_ == ' ' || *at_ == '\t') ++at_;
    Token token;
    if (*at_ == '\0') return token;
    bool bytes_prefix = (*at_ == 'b' || *at_ == 'B') && (at_[1] == '\'' || at_[1] == '"');
    if (bytes_prefix || *at_ == '\'' || *at_ == '"') return string(bytes_prefix);
    if (is_name_start(*at_)) return name();
    if (std::isdigit(static_cast<unsigned char>(*at_)) ||
        (*at_ == '.' && std::isdigit(static_cast<unsigned char>(at_[1])))) {
      return number();
    }
    return op();
  }

 private:
  Token name() {
    Token token{TokenKind::kName, {}};
    while (is_name_char(*at_)) token.text += *at_++;
    // Names beyond ASCII are normalised by the compiler: left to it.
    if (static_cast<unsigned char>(*at_) >= 0x80 || is_reserved(token.text)) {
      token.kind = TokenKind::kBad;
    }
    return token;
  }

  Token number() {
    Token token{TokenKind::kNumber, {}};
    while (is_name_char(*at_) || *at_ == '.' ||
           ((*at_ == '+' || *at_ == '-') && (at_[-1] == 'e' || at_[-1] == 'E') &&
            token.text.rfind("0x", 0) != 0 && token.text.rfind("0X", 0) != 0)) {
      token.text += *at_++;
    }
    return token;
  }

  // A one-line string without escapes or a prefix other than b.
  Token string(bool bytes_prefix) {
    Token token{bytes_prefix ? TokenKind::kBytes : TokenKind::kString, {}};
    if (bytes_prefix) ++at_;
    char quote = *at_++;
    if (at_[0] == quote && at_[1] == quote) return Token{TokenKind::kBad, {}};  // triple
    while (*at_ != quote) {
      bool plain = *at_ != '\0' && *at_ != '\\' && *at_ != '\n' && *at_ != '\r' &&
                   !(bytes_prefix && static_cast<unsigned char>(*at_) >= 0x80);
      if (!plain) return Token{TokenKind::kBad, {}};
      token.text += *at_++;
    }
    ++at_;
    return token;
  }

  Token op() {
    static constexpr const char* kTwo[] = {"==", "!=", "<=", ">="};
    for (const char* two : kTwo) {
      if (at_[0] == two[0] && at_[1] == two[1]) {
        at_ += 2;
        return Token{TokenKind::kOp, two};
      }
    }
    if (std::strchr("<>()[].,-", *at_) != nullptr) return Token{TokenKind::kOp, {*at_++}};
    return Token{TokenKind::kBad, {}};
  }

  const char* at_;
};

// ---- Constants ----------------------------------------------------------------------------

// The value of a number literal, or a null Ref (nothing raised) for a form left to the compiler.
Ref number_value(const std::string& text) {
  if (text.find_first_of("jJ") != std::string::npos) return Ref();  // imaginary
  bool prefixed =
      text.size() > 1 && text[0] == '0' && std::isalpha(static_cast<unsigned char>(text[1]));
  bool is_float = !prefixed && text.find_first_of(".eE") != std::string::npos;
  Ref value;
  if (is_float) {
    Ref source = Ref::steal(PyUnicode_FromString(text.c_str()));
    if (source) value = Ref::steal(PyFloat_FromString(source.get()));
  } else {
    value = Ref::steal(PyLong_FromString(text.c_str(), nullptr, 0));
  }
  PyErr_Clear();
  return value;
}

// ---- Parser -------------------------------------------------------------------------------

class Parser {
 public:
  explicit Parser(const char* text) : lexer_(text) { advance(); }

  // The whole text as a condition; false when any of it is not of the accepted shapes.
  bool parse(FastCondition& out) { return disjunction(out) && token_.kind == TokenKind::kEnd; }

 private:
  void advance() { token_ = lexer_.next(); }
  bool at_op(const char* op) const { return token_.kind == TokenKind::kOp && token_.text == op; }
  bool at_word(const char* word) const {
    return token_.kind == TokenKind::kName && token_.text == word;
  }

  // Parses `item (word item)*` into a kOr or kAnd node (or just the item).
  template <typename Item>
  bool chain(FastCondition& out, const char* word, NodeKind kind, Item item) {
    FastCondition first;
    if (!(this->*item)(first)) return false;
    if (!at_word(word)) {
      out = std::move(first);
      return true;
    }
    out.kind = kind;
    out.children.push_back(std::move(first));
    while (at_word(word)) {
      advance();
      out.children.emplace_back();
      if (!(this->*item)(out.children.back())) return false;
    }
    return true;
  }

  bool disjunction(FastCondition& out) {
    return chain(out, "or", NodeKind::kOr, &Parser::conjunction);
  }
  bool conjunction(FastCondition& out) {
    return chain(out, "and", NodeKind::kAnd, &Parser::inversion);
  }

  bool inversion(FastCondition& out) {
    if (!at_word("not")) return comparison(out);
    // Deep nesting is rare in conditions people write; refused, it keeps the recursion of
    // parsing and evaluation short.
    if (++depth_ > kMaxDepth) return false;
    advance();
    out.kind = NodeKind::kNot;
    out.children.emplace_back();
    return inversion(out.children.back());
  }

  // A parenthesised condition, a single comparison, or an operand taken for its truth.
  bool comparison(FastCondition& out) {
    if (at_op("(")) {
      if (++depth_ > kMaxDepth) return false;
      advance();
      if (!disjunction(out) || !at_op(")")) return false;
      advance();
      return true;
    }
    if (!operand(out.left, false)) return false;
    CompareOp op;
    if (!compare_op(op)) {
      out.kind = NodeKind::kTruth;
      return true;
    }
    out.kind = NodeKind::kCompare;
    out.op = op;
    bool membership = op == CompareOp::kIn || op == CompareOp::kNotIn;
    if (!operand(out.right, membership)) return false;
    // Chained comparisons (`a < b < c`) are left to the compiled code.
    return !compare_op(op);
  }

  bool compare_op(CompareOp& op) {
    static constexpr std::pair<const char*, CompareOp> kOps[] = {
        {"<", CompareOp::kLt},  {"<=", CompareOp::kLe}, {"==", CompareOp::kEq},
        {"!=", CompareOp::kNe}, {">", CompareOp::kGt},  {">=", CompareOp::kGe}};
    for (const auto& [text, value] : kOps) {
      if (!at_op(text)) continue;
      op = value;
      advance();
      return true;
    }
    if (at_word("in")) {
      op = CompareOp::kIn;
      advance();
      return true;
    }
    if (at_word("is")) {
      advance();
      op = at_word("not") ? CompareOp::kIsNot : CompareOp::kIs;
      if (op == CompareOp::kIsNot) advance();
      return true;
    }
    if (at_word("not")) {
      advance();
      if (!at_word("in")) return false;  // leaves the parse failing: not a known shape
      op = CompareOp::kNotIn;
      advance();
      return true;
    }
    return false;
  }

  // A name with accesses, or a constant; a tuple of constants only where `tuple_allowed`.
  bool operand(Operand& out, bool tuple_allowed) {
    if (token_.kind == TokenKind::kName && !is_word_constant()) {
      if (at_word("and") || at_word("or") || at_word("not") || at_word("in") || at_word("is")) {
        return false;
      }
      out.name = Ref::steal(PyUnicode_InternFromString(token_.text.c_str()));
      advance();
      return out.name && accesses(out.accesses);
    }
    if (tuple_allowed && at_op("(")) return tuple(out.constant);
    return constant(out.constant);
  }

  bool is_word_constant() const { return at_word("True") || at_word("False") || at_word("None"); }

  bool accesses(std::vector<Access>& out) {
    while (at_op(".") || at_op("[")) {
      bool attribute = at_op(".");
      advance();
      Access access{attribute, Ref()};
      if (attribute) {
        if (token_.kind != TokenKind::kName || is_word_constant()) return false;
        access.key = Ref::steal(PyUnicode_InternFromString(token_.text.c_str()));
        advance();
      } else if (!constant(access.key) || !at_op("]")) {
        return false;
      } else {
        advance();
      }
      if (!access.key) return false;
      out.push_back(std::move(access));
    }
    return true;
  }

  bool constant(Ref& out) {
    bool negative = at_op("-");
    if (negative) advance();
    if (token_.kind == TokenKind::kNumber) {
      out = number_value(token_.text);
      if (out && negative) out = Ref::steal(PyNumber_Negative(out.get()));
    } else if (negative) {
      return false;
    } else if (token_.kind == TokenKind::kString) {
      out = Ref::steal(PyUnicode_DecodeUTF8(token_.text.data(),
                                            static_cast<Py_ssize_t>(token_.text.size()), nullptr));
    } else if (token_.kind == TokenKind::kBytes) {
      out = Ref::steal(PyBytes_FromStringAndSize(token_.text.data(),
                                                 static_cast<Py_ssize_t>(token_.text.size())));
    } else if (is_word_constant()) {
      out = Ref::borrow(at_word("True") ? Py_True : at_word("False") ? Py_False : Py_None);
    } else {
      return false;
    }
    PyErr_Clear();
    advance();
    return bool(out);
  }

  // `(c1, c2, ...)` of constants, a trailing comma allowed; `()` and `(c)` are refused.
  bool tuple(Ref& out) {
    advance();
    std::vector<Ref> items;
    bool comma = false;
    while (!at_op(")")) {
      items.emplace_back();
      if (!constant(items.back())) return false;
      if (!at_op(",")) break;
      comma = true;
      advance();
    }
    if (!at_op(")") || !comma) return false;
    advance();
    out = Ref::steal(PyTuple_New(static_cast<Py_ssize_t>(items.size())));
    if (!out) {
      PyErr_Clear();
      return false;
    }
    for (size_t i = 0; i < items.size(); ++i) {
      PyTuple_SET_ITEM(out.get(), static_cast<Py_ssize_t>(i), items[i].release());
    }
    return true;
  }

  static constexpr int kMaxDepth = 64;
  Lexer lexer_;
  Token token_;
  int depth_ = 0;  // `not`s and parentheses met so far
};

// ---- Evaluation ---------------------------------------------------------------------------

// Types whose comparisons and truth run no Python code.
bool is_simple(PyObject* obj) {
  return PyLong_CheckExact(obj) || PyFloat_CheckExact(obj) || PyUnicode_CheckExact(obj) ||
         PyBytes_CheckExact(obj) || PyBool_Check(obj) || obj == Py_None;
}

// Containers whose membership test runs no Python code for a simple item: strings, bytes,
// and tuples of simple items (an item of another type could compare with code of its own).
bool is_simple_container(PyObject* obj) {
  if (PyUnicode_CheckExact(obj) || PyBytes_CheckExact(obj)) return true;
  if (!PyTuple_CheckExact(obj)) return false;
  for (Py_ssize_t i = 0; i < PyTuple_GET_SIZE(obj); ++i) {
    if (!is_simple(PyTuple_GET_ITEM(obj, i))) return false;
  }
  return true;
}

// What a condition's names are looked up in, made as far as the condition needs it.
struct Scope {
  PyFrameObject* frame;
  Ref locals;   // the frame's locals mapping, once asked for
  Ref globals;  // the frame's globals, once asked for
};

// Value of `name` in a mapping without running Python code: only dictionaries are read.
// False when the mapping is of another kind or the look-up failed.
bool dict_value(PyObject* mapping, PyObject* name, Ref& value) {
  if (!PyDict_CheckExact(mapping)) return false;
  value = Ref::borrow(PyDict_GetItemWithError(mapping, name));
  return value || PyErr_Occurred() == nullptr;
}

Ref global_value(Scope& scope, PyObject* name) {
  if (!scope.globals) scope.globals = Ref::steal(PyFrame_GetGlobals(scope.frame));
  Ref value;
  if (!scope.globals || !dict_value(scope.globals.get(), name, value)) return Ref();
  return value;
}

// A name as the compiled code reads it: the locals, then the globals. A function frame's
// plain variable is read from its slot where the interpreter lets us; from 3.13 on a
// function frame's locals are a proxy whose item access reads the frame's variables (no
// Python code). A name found in neither is left to the compiled code (a builtin, or an
// error).
Ref name_value(Scope& scope, PyObject* name) {
  Ref value;
  PyObject* slot = nullptr;
  compat::FastLocal read = compat::frame_fast_local(scope.frame, name, &slot);
  if (read == compat::FastLocal::kValue) return Ref::borrow(slot);
  if (read == compat::FastLocal::kUnbound) return global_value(scope, name);
  if (!scope.locals) scope.locals = Ref::steal(PyFrame_GetLocals(scope.frame));
  if (!scope.locals) return Ref();
  if (compat::is_frame_locals_proxy(scope.locals.get())) {
    value = Ref::steal(PyObject_GetItem(scope.locals.get(), name));
    if (value) return value;
    if (!PyErr_ExceptionMatches(PyExc_KeyError)) return Ref();
    PyErr_Clear();
  } else if (!dict_value(scope.locals.get(), name, value)) {
    return Ref();
  }
  if (value) return value;
  return global_value(scope, name);
}

// `obj.name` where that reads the instance's (or module's) own dictionary: the type has no
// attribute of that name, so no descriptor, property or __getattr__ can run.
Ref attribute_value(PyObject* obj, PyObject* name) {
  PyTypeObject* type = Py_TYPE(obj);
  if (compat::type_lookup(type, name) != nullptr) return Ref();
  if (PyModule_CheckExact(obj)) {
    Ref value;
    if (!dict_value(PyModule_GetDict(obj), name, value)) return Ref();
    return value;
  }
  if (type->tp_getattro != PyObject_GenericGetAttr) return Ref();
  return Ref::steal(PyObject_GenericGetAttr(obj, name));
}

// `obj[key]` for containers whose item access runs no Python code for a simple key.
Ref item_value(PyObject* obj, PyObject* key) {
  if (!is_simple(key)) return Ref();
  bool by_index = PyLong_CheckExact(key) || PyBool_Check(key);
  if (PyDict_CheckExact(obj)) {
    Ref value;
    if (!dict_value(obj, key, value)) return Ref();
    return value;
  }
  bool sequence = PyList_CheckExact(obj) || PyTuple_CheckExact(obj) || PyUnicode_CheckExact(obj) ||
                  PyBytes_CheckExact(obj);
  if (!sequence || !by_index) return Ref();
  return Ref::steal(PyObject_GetItem(obj, key));
}

Ref operand_value(Scope& scope, const Operand& operand) {
  if (operand.constant) return operand.constant;
  Ref value = name_value(scope, operand.name.get());
  for (const Access& access : operand.accesses) {
    if (!value) break;
    value = access.attribute ? attribute_value(value.get(), access.key.get())
                             : item_value(value.get(), access.key.get());
  }
  return value;
}

int truth_of(PyObject* obj) {
  if (obj == nullptr || !is_simple(obj)) return kFastUndecided;
  int truth = PyObject_IsTrue(obj);
  return truth < 0 ? kFastUndecided : truth;
}

int compare(CompareOp op, PyObject* left, PyObject* right) {
  if (op == CompareOp::kIs) return left == right ? 1 : 0;
  if (op == CompareOp::kIsNot) return left != right ? 1 : 0;
  if (!is_simple(left)) return kFastUndecided;
  if (op == CompareOp::kIn || op == CompareOp::kNotIn) {
    if (!is_simple_container(right)) return kFastUndecided;
    int found = PySequence_Contains(right, left);
    if (found < 0) return kFastUndecided;
    return op == CompareOp::kIn ? found : !found;
  }
  if (!is_simple(right)) return kFastUndecided;
  static constexpr int kRich[] = {Py_LT, Py_LE, Py_EQ, Py_NE, Py_GT, Py_GE};
  Ref result = Ref::steal(PyObject_RichCompare(left, right, kRich[static_cast<int>(op)]));
  return truth_of(result.get());
}

int evaluate(const FastCondition& node, Scope& scope) {
  switch (node.kind) {
    case NodeKind::kOr:
    case NodeKind::kAnd: {
      // `a or b` is true when a is, else b's truth; `and` the other way round.
      int decisive = node.kind == NodeKind::kOr ? 1 : 0;
      int answer = 1 - decisive;
      for (const FastCondition& child : node.children) {
        answer = evaluate(child, scope);
        if (answer == kFastUndecided || answer == decisive) return answer;
      }
      return answer;
    }
    case NodeKind::kNot: {
      int answer = evaluate(node.children.front(), scope);
      return answer == kFastUndecided ? answer : !answer;
    }
    case NodeKind::kTruth: {
      Ref value = operand_value(scope, node.left);
      return truth_of(value.get());
    }
    case NodeKind::kCompare: {
      Ref left = operand_value(scope, node.left);
      if (!left) return kFastUndecided;
      Ref right = operand_value(scope, node.right);
      if (!right) return kFastUndecided;
      return compare(node.op, left.get(), right.get());
    }
  }
  return kFastUndecided;
}

}  // namespace

std::shared_ptr<const FastCondition> fast_condition_parse(const char* text) {
  auto condition = std::make_shared<FastCondition>();
  bool parsed = Parser(text).parse(*condition);
  PyErr_Clear();
  if (!parsed) return nullptr;
  return condition;
}

int fast_condition_evaluate(const FastCondition& condition, PyFrameObject* frame) {
  Scope scope{frame, Ref(), Ref()};
  int answer = evaluate(condition, scope);
  PyErr_Clear();
  return answer;
}
