"""Conversion between plain Python/JSON values and typed D-Bus values.

Everything the simulator sends (properties, signals, agent arguments, the
control interface's EmitSignal) goes through `to_dbus`, so the D-Bus type of a
value always comes from an explicit signature and never from dbus-python's
guessing (which would, for example, send an `i` where BlueZ sends a `u`).
`format_value` is the single place that renders values for the call log.
"""

import dbus

_INTEGERS = {
    'y': dbus.Byte, 'n': dbus.Int16, 'q': dbus.UInt16, 'i': dbus.Int32,
    'u': dbus.UInt32, 'x': dbus.Int64, 't': dbus.UInt64,
}
_STRINGS = {'s': dbus.String, 'o': dbus.ObjectPath, 'g': dbus.Signature}


class ConversionError(ValueError):
    """A value does not fit the D-Bus signature it is converted to."""


def split_signature(signature):
    """Split a signature into its complete types ('sa{sv}' -> ['s', 'a{sv}'])."""
    try:
        return [str(t) for t in dbus.Signature(signature)]
    except (ValueError, TypeError) as e:
        raise ConversionError(f'bad signature {signature!r}: {e}') from e


def to_dbus(sig, value, variant_level=0):
    """Convert `value` to the dbus-python type for the single complete type `sig`.

    JSON conventions: a variant is a two-element list [inner_signature, value];
    dictionary keys are strings and are converted by the key type (so a{us}
    keys are decimal strings); structs are lists.
    """
    kw = {'variant_level': variant_level} if variant_level else {}
    try:
        if sig in _INTEGERS:
            if isinstance(value, bool) or not isinstance(value, int):
                raise ConversionError(f'{value!r} is not an integer for {sig!r}')
            return _INTEGERS[sig](value, **kw)
        if sig == 'b':
            if not isinstance(value, bool):
                raise ConversionError(f'{value!r} is not a boolean')
            return dbus.Boolean(value, **kw)
        if sig == 'd':
            if isinstance(value, bool) or not isinstance(value, (int, float)):
                raise ConversionError(f'{value!r} is not a number')
            return dbus.Double(value, **kw)
        if sig in _STRINGS:
            if not isinstance(value, str):
                raise ConversionError(f'{value!r} is not a string for {sig!r}')
            return _STRINGS[sig](value, **kw)
        if sig == 'v':
            return _variant(value, variant_level)
        if sig.startswith('a{'):
            return _dict(sig, value, kw)
        if sig.startswith('a'):
            if not isinstance(value, (list, tuple)):
                raise ConversionError(f'{value!r} is not a list for {sig!r}')
            elem = sig[1:]
            return dbus.Array([to_dbus(elem, v) for v in value], signature=elem, **kw)
        if sig.startswith('('):
            fields = split_signature(sig[1:-1])
            if not isinstance(value, (list, tuple)) or len(value) != len(fields):
                raise ConversionError(f'{value!r} does not fit struct {sig}')
            return dbus.Struct([to_dbus(f, v) for f, v in zip(fields, value)],
                               signature=sig[1:-1], **kw)
    except (OverflowError, TypeError) as e:
        raise ConversionError(f'{value!r} does not fit {sig!r}: {e}') from e
    except ValueError as e:
        if isinstance(e, ConversionError):
            raise
        raise ConversionError(f'{value!r} does not fit {sig!r}: {e}') from e
    raise ConversionError(f'unsupported type {sig!r}')


def _variant(value, variant_level):
    if not isinstance(value, (list, tuple)) or len(value) != 2 or not isinstance(value[0], str):
        raise ConversionError(f'variant must be [signature, value], got {value!r}')
    inner = split_signature(value[0])
    if len(inner) != 1:
        raise ConversionError(f'variant needs one complete type, got {value[0]!r}')
    return to_dbus(inner[0], value[1], variant_level + 1)


def _dict(sig, value, kw):
    if not isinstance(value, dict):
        raise ConversionError(f'{value!r} is not an object for {sig!r}')
    key_sig, val_sig = sig[2], sig[3:-1]
    result = dbus.Dictionary(signature=key_sig + val_sig, **kw)
    for k, v in value.items():
        result[to_dbus(key_sig, _key_from_text(key_sig, k))] = to_dbus(val_sig, v)
    return result


def _key_from_text(key_sig, key):
    """JSON object keys are always strings; turn them into the key type."""
    if not isinstance(key, str):
        return key
    if key_sig in _INTEGERS:
        try:
            return int(key, 10)
        except ValueError as e:
            raise ConversionError(f'dictionary key {key!r} is not a decimal number') from e
    if key_sig == 'b':
        if key not in ('true', 'false'):
            raise ConversionError(f'dictionary key {key!r} is not true/false')
        return key == 'true'
    if key_sig == 'd':
        return float(key)
    return key


def args_to_dbus(signature, values):
    """Convert a list of top-level values by a multi-type signature."""
    types = split_signature(signature)
    if not isinstance(values, list) or len(values) != len(types):
        raise ConversionError(f'expected a list of {len(types)} values for {signature!r}')
    return [to_dbus(t, v) for t, v in zip(types, values)]


def variant(sig, value):
    """A value wrapped as a variant of the given type (for a{sv} and `v`)."""
    return to_dbus(sig, value, variant_level=1)


def props_dict(items):
    """Build an a{sv} from (name, signature, value) triples, keeping their order."""
    return dbus.Dictionary({name: variant(sig, value) for name, sig, value in items},
                           signature='sv')


def format_value(value):
    """Render one D-Bus value for the call log (strings bare, booleans true/false)."""
    if isinstance(value, dbus.Boolean) or isinstance(value, bool):
        return 'true' if value else 'false'
    if isinstance(value, int):
        return str(int(value))
    if isinstance(value, float):
        return repr(float(value))
    if isinstance(value, str):
        return str(value)
    if isinstance(value, dict):
        return '{' + ', '.join(f'{format_value(k)}: {format_value(v)}'
                               for k, v in value.items()) + '}'
    if isinstance(value, dbus.Struct):
        return '(' + format_args(value) + ')'
    if isinstance(value, (list, tuple)):
        return '[' + format_args(value) + ']'
    return str(value)


def format_args(values):
    """Render an argument list for the call log: values joined by ', '."""
    return ', '.join(format_value(v) for v in values)


_SIGNATURE_OF = {
    dbus.Boolean: 'b', dbus.Byte: 'y', dbus.Int16: 'n', dbus.UInt16: 'q', dbus.Int32: 'i',
    dbus.UInt32: 'u', dbus.Int64: 'x', dbus.UInt64: 't', dbus.Double: 'd',
    dbus.String: 's', dbus.ObjectPath: 'o', dbus.Signature: 'g',
}


def basic_signature_of(value):
    """Type code of a received basic value (a variant's content), '' for containers."""
    return _SIGNATURE_OF.get(type(value), '')
