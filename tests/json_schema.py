"""A validator for JSON Schema, as far as docs/events.schema.json needs it.

A keyword that it does not know is an error, so that no check is passed over in silence.
"""
import re

TYPES = {
    "object": lambda value: isinstance(value, dict),
    "string": lambda value: isinstance(value, str),
    "boolean": lambda value: isinstance(value, bool),
    "integer": lambda value: isinstance(value, int) and not isinstance(value, bool),
    "number": lambda value: isinstance(value, (int, float)) and not isinstance(value, bool),
}
ANNOTATIONS = {"$schema", "$defs", "title", "description"}


class Validator:
    def __init__(self, schema):
        self.root = schema

    def errors(self, value, schema=None, path="$"):
        """Every way in which the value does not fit, in words."""
        schema = self.root if schema is None else schema
        if isinstance(schema, bool):
            return [] if schema else [path + ": must not be there"]
        found = []
        for keyword, rule in schema.items():
            if keyword not in ANNOTATIONS:
                found += getattr(self, "_" + keyword.replace("$", ""), self._unknown(keyword))(value, rule, schema, path)
        return found

    @staticmethod
    def _unknown(keyword):
        def refuse(*_):
            raise NotImplementedError("schema keyword " + keyword)
        return refuse

    def _ref(self, value, rule, _, path):
        target = self.root
        for part in rule.removeprefix("#/").split("/"):
            target = target[part]
        return self.errors(value, target, path)

    def _type(self, value, rule, _, path):
        return [] if TYPES[rule](value) else [f"{path}: {value!r} is no {rule}"]

    def _const(self, value, rule, _, path):
        return [] if value == rule else [f"{path}: {value!r} is not {rule!r}"]

    def _enum(self, value, rule, _, path):
        return [] if value in rule else [f"{path}: {value!r} is none of {rule}"]

    def _pattern(self, value, rule, _, path):
        return [] if not isinstance(value, str) or re.search(rule, value) else [f"{path}: {value!r} does not match {rule}"]

    def _minLength(self, value, rule, _, path):
        return [] if not isinstance(value, str) or len(value) >= rule else [f"{path}: too short"]

    def _minimum(self, value, rule, _, path):
        return [] if not TYPES["number"](value) or value >= rule else [f"{path}: {value} is below {rule}"]

    def _maximum(self, value, rule, _, path):
        return [] if not TYPES["number"](value) or value <= rule else [f"{path}: {value} is above {rule}"]

    def _required(self, value, rule, _, path):
        return [f"{path}: {key} is missing" for key in rule if isinstance(value, dict) and key not in value]

    def _dependentRequired(self, value, rule, _, path):
        return [f"{path}: {key} without {other}" for key, others in rule.items() if isinstance(value, dict) and key in value
                for other in others if other not in value]

    def _properties(self, value, rule, _, path):
        if not isinstance(value, dict):
            return []
        return [error for key, part in rule.items() if key in value for error in self.errors(value[key], part, f"{path}.{key}")]

    def _additionalProperties(self, value, rule, schema, path):
        others = [key for key in value if key not in schema.get("properties", {})] if isinstance(value, dict) else []
        return [error for key in others for error in self.errors(value[key], rule, f"{path}.{key}")]

    def _oneOf(self, value, rule, _, path):
        branches = [self.errors(value, part, path) for part in rule]
        fitting = sum(not branch for branch in branches)
        if fitting == 1:
            return []
        return [f"{path}: fits {fitting} of {len(rule)} alternatives"] + [error for branch in branches for error in branch]
