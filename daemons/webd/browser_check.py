#!/usr/bin/python3
"""Drives the page in headless Chromium as a person would: the administrator indexes a folder
and watches it finish, then a user signs in, types a word, takes a suggestion, opens a hit's
folder and filters by kind. Screenshots of both pages go to OUT_DIR.

usage: browser_check.py URL ADMIN USER PASSWORD SHARE_FOLDER WORD OUT_DIR
Exits 0 when every step saw what it should; otherwise prints the step and exits 1.
"""
import os
import sys
import tempfile

from selenium import webdriver
from selenium.webdriver.chrome.service import Service
from selenium.webdriver.common.by import By
from selenium.common.exceptions import StaleElementReferenceException
from selenium.webdriver.common.keys import Keys
from selenium.webdriver.support import expected_conditions as ec
from selenium.webdriver.support.ui import Select, WebDriverWait

url, admin, user, password, share_folder, word, out_dir = sys.argv[1:8]
os.makedirs(out_dir, exist_ok=True)

options = webdriver.ChromeOptions()
for arg in ("--headless=new", "--no-sandbox", "--disable-gpu", "--disable-dev-shm-usage",
            "--window-size=1280,900", "--lang=en-GB"):
    options.add_argument(arg)
profile = tempfile.TemporaryDirectory(prefix="webd-chromium-")
options.add_argument("--user-data-dir=" + profile.name)
options.binary_location = "/usr/bin/chromium"
service = Service(executable_path="/usr/bin/chromedriver")
driver = webdriver.Chrome(service=service, options=options)
# The results are redrawn as searches come back: an element read while it is replaced is read
# again at the next poll.
wait = WebDriverWait(driver, 60, ignored_exceptions=(StaleElementReferenceException,))
step = "start"


def visible(css):
    return wait.until(ec.visibility_of_element_located((By.CSS_SELECTOR, css)))


def sign_in(name):
    driver.get(url)
    visible("#signin-user").send_keys(name)
    driver.find_element(By.ID, "signin-password").send_keys(password + Keys.ENTER)
    visible("#who")
    wait.until(lambda d: d.find_element(By.ID, "who").text == name)


def sign_out():
    driver.find_element(By.ID, "signout").click()
    visible("#signin-user")


try:
    step = "the administrator signs in and sees the administration link"
    sign_in(admin)
    visible("#nav-admin").click()
    step = "the folder picker lists the share and its folders"
    share = "/" + share_folder.strip("/").split("/")[0]
    wait.until(lambda d: any(b.text.strip() == share[1:] for b in
                             d.find_elements(By.CSS_SELECTOR, "#picker-list button")))
    for part in share_folder.strip("/").split("/"):
        button = wait.until(lambda d: next((b for b in d.find_elements(
            By.CSS_SELECTOR, "#picker-list button") if b.text.strip() == part), None))
        button.click()
    wait.until(lambda d: d.find_element(By.ID, "picker-path").text == share_folder)
    step = "adding the folder shows it with its progress until it is finished"
    driver.find_element(By.ID, "add-photo").click()
    driver.find_element(By.ID, "add-button").click()
    badge = f'.badge[data-path="{share_folder}"]'
    visible(badge)
    wait.until(lambda d: d.find_element(By.CSS_SELECTOR, badge).text == "finished")
    driver.save_screenshot(os.path.join(out_dir, "admin.png"))
    sign_out()

    step = "a user signs in and sees no administration link"
    sign_in(user)
    if driver.find_element(By.ID, "nav-admin").is_displayed():
        raise AssertionError("an ordinary user sees the administration link")
    step = "typing part of a word offers the whole word and shows hits while typing"
    box = visible("#q")
    box.send_keys(word[:4])
    suggestion = wait.until(lambda d: next((li for li in d.find_elements(
        By.CSS_SELECTOR, "#suggestions li") if li.text == word), None))
    wait.until(lambda d: len(d.find_elements(By.CSS_SELECTOR, "#results li")) > 0)
    step = "taking the suggestion searches the word, with it highlighted in the snippets"
    box.send_keys(Keys.ARROW_DOWN, Keys.ENTER)
    wait.until(lambda d: d.find_element(By.ID, "q").get_attribute("value") == word + " ")
    wait.until(lambda d: any(m.text.lower() == word.lower() for m in
                             d.find_elements(By.CSS_SELECTOR, "#results mark")))
    driver.save_screenshot(os.path.join(out_dir, "search.png"))
    total = driver.find_element(By.ID, "status").text
    step = "opening a hit's folder narrows the search to it"
    first = driver.find_element(By.CSS_SELECTOR, "#results .hit-folder")
    folder = first.text
    first.click()
    wait.until(lambda d: d.find_element(By.ID, "f-folder-text").text == "In " + folder)
    wait.until(lambda d: d.find_element(By.ID, "status").text not in ("", total) and all(
        (f.text + "/").startswith(folder + "/")
        for f in d.find_elements(By.CSS_SELECTOR, "#results .hit-folder")))
    driver.find_element(By.ID, "f-folder-clear").click()
    step = "filtering by kind keeps only that kind"
    Select(driver.find_element(By.ID, "f-kind")).select_by_value("photo")
    wait.until(lambda d: d.find_elements(By.CSS_SELECTOR, "#results .hit-name a") and all(
        a.text.lower().endswith((".jpg", ".png")) for a in
        d.find_elements(By.CSS_SELECTOR, "#results .hit-name a")))
    Select(driver.find_element(By.ID, "f-kind")).select_by_value("")
    step = "a word found nowhere says so"
    box.clear()
    box.send_keys("qqqnothingmatches ")
    wait.until(lambda d: d.find_element(By.ID, "status").text.startswith("No files match"))
    step = "the page fits a phone"
    box.clear()
    box.send_keys(word + " ")
    wait.until(lambda d: len(d.find_elements(By.CSS_SELECTOR, "#results li")) > 0)
    driver.set_window_size(390, 844)
    width = driver.execute_script("return document.documentElement.scrollWidth")
    if width > 400:
        raise AssertionError(f"the page is {width} px wide on a phone")
    driver.save_screenshot(os.path.join(out_dir, "search-phone.png"))
except Exception as e:  # pylint: disable=broad-except
    driver.save_screenshot(os.path.join(out_dir, "failed.png"))
    print(f"browser check failed at: {step}: {type(e).__name__}: {e}", file=sys.stderr)
    sys.exit(1)
finally:
    driver.quit()
print("browser check passed; screenshots in " + out_dir)
