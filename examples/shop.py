"""Totals a small shop's orders and prints a report.

The report's average order value is wrong. Run `tools/run-example` to find out why under the
debugger (README.md shows a session that does).
"""

ORDERS = [
    ("apples", 6, 0.50),
    ("bread", 1, 2.25),
    ("cheese", 2, 4.00),
]


def line_total(quantity, price):
    return quantity * price


def summarize(orders):
    total = 0.0
    count = 0
    for name, quantity, price in orders:
        total += line_total(quantity, price)
    count += 1
    return total, total / count


def main():
    total, average = summarize(ORDERS)
    print(f"orders: {len(ORDERS)}")
    print(f"total: {total:.2f}")
    print(f"average per order: {average:.2f}")


if __name__ == "__main__":
    main()
