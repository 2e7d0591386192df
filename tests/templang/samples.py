"""The order page the template tests render, and the hook's name as the console takes it."""

HOOK = "templang.debughook:TemplateHook"

ORDER_PAGE = """\
Order for {{ customer }}
{% set total = 0 %}
{% for name, qty, price in items %}
- {{ name }}: {{ money(qty * price) }}
{% set total = total + qty * price %}
{% end %}
Total: {{ money(total) }}
"""
