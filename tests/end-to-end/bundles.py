"""Writes property lists and bundles for tests, without the project's own code."""

import os
from xml.sax.saxutils import escape


def _element(value):
    if isinstance(value, bool):
        return "<true/>" if value else "<false/>"
    if isinstance(value, int):
        return f"<integer>{value}</integer>"
    if isinstance(value, str):
        return f"<string>{escape(value)}</string>"
    if isinstance(value, list):
        return "<array>" + "".join(_element(element) for element in value) + "</array>"
    if isinstance(value, dict):
        entries = "".join(f"<key>{escape(key)}</key>{_element(element)}" for key, element in value.items())
        return f"<dict>{entries}</dict>"
    raise TypeError(type(value))


def vlist(value):
    return ('<?xml version="1.0" encoding="UTF-8"?>\n<vlist version="1.0">' + _element(value) + "</vlist>\n").encode()


def manifest(identifier, **extension):
    """A well-configured data-only plug-in's manifest; keywords replace or add entries of its plug-in dictionary."""
    return {
        "VBBundleIdentifier": identifier,
        "VBBundleDisplayName": identifier,
        "VBBundleVersion": "1",
        "VKExtension": {
            "VKExtensionPointIdentifier": "com.example.point",
            "VKExtensionProtocol": "#Data",
            "VKExtensionAttributes": {"VKExtensionVersion": "1.0"},
            **extension,
        },
    }


def write(path, content):
    os.makedirs(os.path.dirname(path), exist_ok=True)
    temporary = path + ".new"
    with open(temporary, "wb") as file:
        file.write(content if isinstance(content, bytes) else vlist(content))
    os.rename(temporary, path)


def application(root, name, plugins):
    """Lays out an application: `plugins` maps a bundle name to a manifest, as bytes or as a dictionary. Answers its path.

    The application appears as a whole: it is made aside and moved in."""
    aside = os.path.join(root, "var", name + ".aside")
    for plugin, content in plugins.items():
        write(os.path.join(aside, "PlugIns", plugin, "Info.vlist"), content)
    write(os.path.join(aside, "Info.vlist"),
          {"VBBundleIdentifier": "com.example." + name, "VBBundleDisplayName": name, "VBBundleVersion": "1"})
    path = os.path.join(root, "Applications", name + ".app")
    os.rename(aside, path)
    return path


def plugin_path(application_path, plugin):
    return os.path.join(application_path, "PlugIns", plugin)
