"""Dataclasses filled from TOML tables: their fields define the keys, their types and their defaults."""

import dataclasses
from typing import Any, Literal, TypeVar, get_args, get_origin, get_type_hints

Section = TypeVar("Section")


class FieldError(Exception):
    """A value that a field cannot take. `key` is the field's name, preceded by the section's."""

    def __init__(self, key: str, reason: str) -> None:
        super().__init__(f"{key}: {reason}")
        self.key = key
        self.reason = reason


def check(key: str, value: object, allowed: Any) -> None:
    """Checks that `value` is of the type `allowed`: a plain type, a Literal, or a list or dict of these.

    Raises FieldError.
    """
    kind = get_origin(allowed) or allowed
    if kind is Literal:
        if value not in get_args(allowed):
            raise FieldError(key, f"must be one of {', '.join(map(repr, get_args(allowed)))}, not {value!r}")
    elif type(value) is not kind:  # bool is an int
        raise FieldError(key, f"must be of type {kind.__name__}, not {value!r}")
    elif isinstance(value, (list, dict)) and get_args(allowed):
        for entry in value.values() if isinstance(value, dict) else value:
            check(key, entry, get_args(allowed)[-1])
    elif "\0" in str(value):
        raise FieldError(key, "must be without null characters")


def fill(section: type[Section], prefix: str, values: dict[str, Any]) -> Section:
    """A `section`, a dataclass, with these `values`. `prefix` goes before a key in errors. Raises FieldError."""
    types = get_type_hints(section)
    for key in values:
        if key not in types:
            raise FieldError(f"{prefix}{key}", f"not known; the keys are {', '.join(types)}")
    for field in dataclasses.fields(section):
        if field.name in values:
            check(f"{prefix}{field.name}", values[field.name], types[field.name])
        elif field.default is field.default_factory is dataclasses.MISSING:
            raise FieldError(f"{prefix}{field.name}", "is missing")
    return section(**values)
