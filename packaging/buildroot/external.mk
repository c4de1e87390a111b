include $(sort $(wildcard $(BR2_EXTERNAL_MIGRATE_SETTINGS_PATH)/package/*/*.mk))
