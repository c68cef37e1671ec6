"""A started daemon has created every log table, exactly as declared."""
import re
import unittest

from harness import DeviceTestCase, wait_for

SURVEY_TABLES = {
    "use_app_survey": "CREATE TABLE IF NOT EXISTS use_app_survey(_id INTEGER PRIMARY KEY "
    "AUTOINCREMENT, timestamp INTEGER, time_zone TEXT, app_id TEXT, duration INTEGER );",
    "manage_app_survey": "CREATE TABLE IF NOT EXISTS manage_app_survey(_id INTEGER PRIMARY KEY "
    "AUTOINCREMENT, timestamp INTEGER, time_zone TEXT, installed_app_id TEXT, "
    "type INTEGER DEFAULT 0 );",
    "report_app_error_survey": "CREATE TABLE IF NOT EXISTS report_app_error_survey(_id INTEGER "
    "PRIMARY KEY AUTOINCREMENT, timestamp INTEGER, time_zone TEXT, app_id TEXT, type INTEGER );",
    "use_app_feature_survey": "CREATE TABLE IF NOT EXISTS use_app_feature_survey(_id INTEGER "
    "PRIMARY KEY AUTOINCREMENT, timestamp INTEGER, time_zone TEXT, app_id TEXT, feature TEXT, "
    "extra TEXT, value INTEGER);",
    "report_app_status_survey": "CREATE TABLE IF NOT EXISTS report_app_status_survey(_id "
    "INTEGER PRIMARY KEY AUTOINCREMENT, timestamp INTEGER, time_zone TEXT, app_id TEXT, "
    "feature TEXT, extra TEXT, value INTEGER);",
}
QUEUE_TABLES = {
    "survey_log": "CREATE TABLE IF NOT EXISTS survey_log(_id INTEGER PRIMARY KEY AUTOINCREMENT "
    "NOT NULL, timestamp INTEGER, svc_code TEXT, category_code TEXT, activity TEXT, "
    "log_type TEXT, app_version TEXT, body TEXT, rly_result INTEGER);",
}


def stored_form(create):
    """sqlite_master keeps the statement without IF NOT EXISTS and the final semicolon."""
    return re.sub(r"^CREATE TABLE IF NOT EXISTS ", "CREATE TABLE ", create).rstrip(";")


class TablesTest(DeviceTestCase):

    def tables(self, db):
        return dict(self.dev.query(
            db, "SELECT name, sql FROM sqlite_master WHERE type='table' "
                "AND name NOT LIKE 'sqlite_%'"))

    def test_started_daemon_has_the_six_tables_with_their_create_texts(self):
        self.dev.set_consent(True)
        self.dev.start_daemon()
        for db, expected in ((".SurveyLog.db", SURVEY_TABLES),
                             (".ServerUploaderDB.db", QUEUE_TABLES)):
            with self.subTest(db=db):
                found = wait_for(lambda: len(self.tables(db)) == len(expected)
                                 and self.tables(db), message=f"the tables of {db}")
                self.assertEqual(found, {name: stored_form(sql) for name, sql in expected.items()})


if __name__ == "__main__":
    unittest.main()
