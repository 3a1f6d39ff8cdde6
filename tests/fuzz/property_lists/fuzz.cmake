velk_fuzz(property_lists LINKS velk_platform)
