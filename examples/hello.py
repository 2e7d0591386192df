"""A small program to watch the debugger core step through."""


def greet(name):
    message = f"hello, {name}"
    return message


def count_letters(words):
    return {word: len(word) for word in words}


if __name__ == "__main__":
    print(greet("world"))
    print(count_letters(["alpha", "beta"]))
